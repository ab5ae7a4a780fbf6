#!/usr/bin/env bash
# SPDX-License-Identifier: MIT
# Measures the client framework against a bare sd_bus_call: builds the benchmark and the
# simulator (optimised, in build/bench unless BUILD_DIR says otherwise), starts a private bus with
# the simulated device and runs the benchmark. Extra arguments go to the benchmark, for example
# --benchmark_repetitions=5. It reports each path's ratio to the bare call against the target; a
# noisy machine gives noisy figures, not a failure.
set -euo pipefail
top=$(cd "$(dirname "$0")/.." && pwd)
build=${BUILD_DIR:-${top}/build/bench}
source "${top}/scripts/packages.sh"
source "${top}/scripts/simulated-device.sh"
ensure_packages >&2

echo "building (optimised) in ${build} ..." >&2
cmake -S "${top}" -B "${build}" -DCMAKE_BUILD_TYPE=Release -DHALVEX_BUILD_TESTS=OFF >/dev/null
cmake --build "${build}" -j "$(nproc)" --target halvex_bench_client halvex-sim >/dev/null

work=$(mktemp -d /tmp/halvex-bench.XXXXXX)
cleanup() {
  stop_simulated_device
  rm -rf "${work}"
}
trap cleanup EXIT
echo '{}' >"${work}/scenario.json"
# The request log goes to /dev/null so that disk speed stays out of the measurement.
start_simulated_device "${build}/sim/halvex-sim" "${work}/scenario.json" "${work}/root" /dev/null

"${build}/bench/halvex_bench_client" "$@"
