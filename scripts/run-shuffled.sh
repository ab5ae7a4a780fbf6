#!/usr/bin/env bash
# SPDX-License-Identifier: MIT
# Runs each test program of a build whole, as ctest does not: all its tests in one process, in a
# random order, three times over. A test that needs to run first, or that leaves state behind
# for the next, fails here. Each program prints the seed of its order; --gtest_random_seed=SEED
# --gtest_shuffle --gtest_repeat=3 repeats it. A program's whole output goes to
# BUILD_DIR/tests/shuffled/NAME.log, its failures to the terminal.
#
# usage: bash scripts/run-shuffled.sh BUILD_DIR [COMMAND...]
# COMMAND, if given, runs each program (setarch x86_64 -R for ThreadSanitizer, say).
set -euo pipefail
build=${1:?usage: run-shuffled.sh BUILD_DIR [COMMAND...]}
shift
prefix=("$@")

logs=${build}/tests/shuffled
mkdir -p "${logs}"
failed=()
while IFS=$'\t' read -r name program wrapper; do
  command=("${prefix[@]}")
  [[ -z ${wrapper} ]] || command+=(/bin/sh "${wrapper}")
  started=${SECONDS}
  # As ctest does, from the program's own directory.
  if (cd "$(dirname "${program}")" &&
    timeout 900 "${command[@]}" "${program}" --gtest_shuffle --gtest_repeat=3) \
    >"${logs}/${name}.log" 2>&1; then
    echo "shuffled: ${name} passed ($((SECONDS - started)) s)"
  else
    failed+=("${name}")
    echo "shuffled: ${name} FAILED ($((SECONDS - started)) s); ${logs}/${name}.log:"
    grep -E "Randomizing tests' orders|Repeating all tests|\[  FAILED  \]|Failure$" \
      "${logs}/${name}.log" | head -40 || true
    echo "..."
    tail -n 5 "${logs}/${name}.log"
  fi
done <"${build}/tests/programs.tsv"

if ((${#failed[@]})); then
  echo "shuffled: failed: ${failed[*]}" >&2
  exit 1
fi
