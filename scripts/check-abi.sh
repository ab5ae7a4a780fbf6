#!/usr/bin/env bash
# SPDX-License-Identifier: MIT
# usage: bash scripts/check-abi.sh [--write] HEADERS LIBRARY...
# Compares each shared LIBRARY (built with debug information) with the baseline of its SONAME,
# abi/<soname>.abi, as abidiff sees it through the public headers under HEADERS: anything but
# added functions and variables fails, with abidiff's account of what changed. --write records
# the libraries as the new baselines instead, which is right only for a new SONAME.
set -euo pipefail
abi=$(cd "$(dirname "$0")/../abi" && pwd)
write=0
if [[ ${1-} == --write ]]; then write=1; shift; fi
(($# >= 2)) || { sed -n 's/^# usage: //p' "$0" >&2; exit 2; }
headers=$1
shift

status=0
for library in "$@"; do
  soname=$(objdump -p "${library}" | awk '$1 == "SONAME" {print $2}')
  [[ -n ${soname} ]] || { echo "check-abi: ${library} has no SONAME" >&2; exit 2; }
  baseline="${abi}/${soname}.abi"
  if ((write)); then
    abidw --exported-interfaces-only --headers-dir "${headers}" --drop-private-types \
      --no-corpus-path --no-comp-dir-path --no-show-locs --out-file "${baseline}" "${library}"
    echo "check-abi: wrote ${baseline}"
    continue
  fi
  [[ -f ${baseline} ]] || { echo "check-abi: no baseline ${baseline} for ${library}" >&2; exit 2; }
  report=$(abidiff --exported-interfaces-only --headers-dir2 "${headers}" --drop-private-types \
    --no-added-syms --suppressions "${abi}/std.suppr" "${baseline}" "${library}") && continue
  code=$?
  # abidiff's status is a bit field: 1 an error, 2 a usage error, 4 an ABI change, 8 an
  # incompatible one.
  if ((code & 3)); then
    printf 'check-abi: abidiff could not compare %s with %s:\n%s\n' \
      "${library}" "${baseline}" "${report}" >&2
    exit 2
  fi
  printf 'check-abi: %s no longer offers the ABI of %s:\n%s\n' \
    "${soname}" "${baseline##*/}" "${report}" >&2
  printf '%s\n' "An incompatible change needs a new SONAME (the major version in CMakeLists.txt)" \
    "and a new baseline (bash scripts/check-abi.sh --write HEADERS LIBRARY...)." >&2
  status=1
done
exit "${status}"
