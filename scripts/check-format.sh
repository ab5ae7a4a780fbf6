#!/usr/bin/env bash
# SPDX-License-Identifier: MIT
# Fails, naming each file, when a C++ source or header that git tracks is not laid out as
# .clang-format says. The clang-format is the one pinned in scripts/packages.sh, since its output
# differs between versions. To fix: clang-format-15 -i FILE...
set -euo pipefail
cd "$(dirname "$0")/.."
format=clang-format-15
mapfile -t files < <(git ls-files '*.cpp' '*.h')
unformatted=()
for file in "${files[@]}"; do
  "${format}" --dry-run -Werror "${file}" 2>/dev/null || unformatted+=("${file}")
done
if ((${#unformatted[@]})); then
  echo "check-format: not formatted (${format} -i FILE... fixes it):" >&2
  printf '  %s\n' "${unformatted[@]}" >&2
  exit 1
fi
echo "check-format: ${#files[@]} files formatted"
