#!/usr/bin/env bash
# SPDX-License-Identifier: MIT
# Runs clang-tidy, with the checks .clang-tidy names, over every source in the given folders as
# the clang preset compiles it, and fails on any finding. Without folders: the whole tree. The
# fuzz targets are compiled only by the fuzz preset (clang too), so theirs come from its build.
# Headers are checked through the sources that include them, and reported only when they lie
# in the given folders. One clang-tidy per core.
#
# usage: bash scripts/tidy.sh [FOLDER...]        for example: bash scripts/tidy.sh shell tests/shell
set -euo pipefail
top=$(cd "$(dirname "$0")/.." && pwd)
cd "${top}"
tidy=clang-tidy-14

folders=("${@%/}")
((${#folders[@]})) || folders=(Tools bench fuzz platform shell sim tests trace)
for folder in "${folders[@]}"; do
  [[ -d ${folder} ]] || {
    echo "tidy: no folder ${folder}" >&2
    exit 2
  }
done

# The sources of one compilation database that lie in the given folders, as "database file".
sources() {
  local build=$1 file folder
  [[ -f ${build}/compile_commands.json ]] || cmake --preset "$(basename "${build}")" >/dev/null
  sed -n 's/^ *"file": "\(.*\)",\{0,1\}$/\1/p' "${build}/compile_commands.json" | sort -u |
    while read -r file; do
      for folder in "${folders[@]}"; do
        if [[ ${file} == "${top}/${folder}/"* ]]; then
          echo "${build} ${file}"
          break
        fi
      done
    done
}

units=$(sources build/clang)
if [[ " ${folders[*]} " == *" fuzz "* ]]; then
  units+=$'\n'$(sources build/fuzz | grep " ${top}/fuzz/" || true)
fi
headers="^${top}/($(IFS='|' && echo "${folders[*]}"))/"

out=$(mktemp -d)
trap 'rm -rf "${out}"' EXIT
started=${SECONDS}
jobs=$(nproc)
running=0
count=0
while read -r build file; do
  log=${out}/$((++count))
  {
    "${tidy}" --quiet -p "${build}" --header-filter="${headers}" "${file}" >"${log}.log" 2>&1 ||
      echo "${build} ${file}" >"${log}.failed"
  } &
  if ((++running >= jobs)); then
    wait -n
    ((running--))
  fi
done < <(echo "${units}" | grep -v '^$')
wait

# A header's findings come once from every source that includes it.
findings=$(cat "${out}"/*.log | grep -E '^/[^ ]*:[0-9]+:[0-9]+: (warning|error): ' | sort -u || true)
failed=$(cat "${out}"/*.failed 2>/dev/null || true)
if [[ -n ${failed} ]]; then
  [[ -z ${findings} ]] || echo "${findings}" | sed "s|^${top}/||" >&2
  echo "tidy: $(echo "${findings}" | grep -c . || true) finding(s); ${tidy} failed on:" >&2
  echo "${failed}" | sed "s|^|  ${tidy} -p |" >&2
  echo "tidy: fix the code, or, for a check that does not fit, leave it out in .clang-tidy" \
    "and say why there" >&2
  exit 1
fi
echo "tidy: ${count} sources in ${folders[*]} clean ($((SECONDS - started)) s)"
