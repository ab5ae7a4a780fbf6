#!/usr/bin/env bash
# SPDX-License-Identifier: MIT
# The whole test suite on a fresh Debian 12 machine: installs what is missing, then configures,
# builds and runs every test under the plain (GCC), AddressSanitizer+UBSan, ThreadSanitizer and
# clang presets, and last the fuzz preset, whose tests run each fuzz target over its seed corpus
# for a few seconds. Each preset with tests also runs every test program whole, shuffled and
# repeated (scripts/run-shuffled.sh); the clang preset runs clang-tidy over the whole tree too
# (scripts/tidy.sh).
# Arguments, if any, name the presets to run instead of all five.
set -euo pipefail
cd "$(dirname "$0")/.."
source scripts/packages.sh
ensure_packages
bash scripts/check-format.sh

presets=("$@")
((${#presets[@]})) || presets=(dev asan tsan clang fuzz)
jobs=$(nproc)

for preset in "${presets[@]}"; do
  echo "=== ${preset}: configure, build, test ==="
  cmake --preset "${preset}" >/dev/null
  cmake --build --preset "${preset}" -j "${jobs}"
  # ThreadSanitizer cannot map its shadow memory under the kernel's largest address
  # randomisation, so its tests run with randomisation off.
  run=()
  [[ ${preset} != tsan ]] || run=(setarch "$(uname -m)" -R)
  "${run[@]}" ctest --preset "${preset}" -j "${jobs}"
  # Then each test program once more, whole: its tests in one process, shuffled, three times.
  # The fuzz preset has none.
  if [[ -f build/${preset}/tests/programs.tsv ]]; then
    bash scripts/run-shuffled.sh "build/${preset}" "${run[@]}"
  fi
  if [[ ${preset} == clang ]]; then
    bash scripts/tidy.sh
  fi
  if [[ ${preset} == dev ]]; then bash scripts/check-packages.sh build/dev; fi
done
echo "=== all presets passed: ${presets[*]} ==="
