#!/usr/bin/env bash
# SPDX-License-Identifier: MIT
# usage: bash scripts/build-packages.sh [OUT [DPKG-BUILDPACKAGE OPTION...]]
# Builds the Debian packages with `dpkg-buildpackage -us -uc -b` from a copy of this tree in
# OUT/halvextool-VERSION (OUT defaults to build/packages and is emptied first), so that all it
# writes stays under OUT: the copy's debian/ work folders and cmake build, and beside the copy the
# packages, OUT/*.deb. The copy holds the tracked files as the work tree has them and the untracked
# ones git does not ignore (everything but build/ when the tree is no git checkout), each dated
# like the release in debian/changelog, so that neither the checkout nor its time shows in the
# packages. The build's output goes to OUT/build.log.
set -euo pipefail
top=$(cd "$(dirname "$0")/.." && pwd)
out=${1:-${top}/build/packages}
shift $(($# ? 1 : 0))

version=$(dpkg-parsechangelog -l "${top}/debian/changelog" -S Version)
released=$(dpkg-parsechangelog -l "${top}/debian/changelog" -S Timestamp)
if [[ -d ${out} && ! -f ${out}/build.log && -n $(ls -A "${out}") ]]; then
  echo "build-packages: ${out} holds something other than a package build; name another folder" >&2
  exit 2
fi
rm -rf "${out}"
mkdir -p "${out}"
out=$(cd "${out}" && pwd)
: >"${out}/build.log"
copy="${out}/halvextool-${version}"
mkdir "${copy}"

cd "${top}"
if git rev-parse --is-inside-work-tree >/dev/null 2>&1; then
  git ls-files -z --cached --others --exclude-standard
else
  find . -path ./build -prune -o -path ./.git -prune -o \( -type f -o -type l \) -printf '%P\0'
fi | while IFS= read -r -d '' file; do
  # A tracked file deleted in the work tree is not part of it.
  if [[ -e ${file} || -L ${file} ]]; then printf '%s\0' "${file}"; fi
done | tar --null --files-from=- --mtime="@${released}" -cf - | tar -xf - -C "${copy}"

echo "building the packages in ${copy} (log: ${out}/build.log)"
if ! (cd "${copy}" && dpkg-buildpackage -us -uc -b -j"$(nproc)" "$@") >"${out}/build.log" 2>&1; then
  tail -n 40 "${out}/build.log" >&2
  echo "build-packages: dpkg-buildpackage failed; the whole log is ${out}/build.log" >&2
  exit 1
fi
ls "${out}"/*.deb
