#!/usr/bin/env bash
# SPDX-License-Identifier: MIT
# Runs halvextool against the built-in simulated device on a fresh Debian 12 machine: installs
# what is missing, builds the tool and the simulator, starts a private bus with a working device
# (server started, baseband logs enabled), then runs the tool. With no arguments the tool is
# interactive; arguments are passed to it as one command line. The tool's exit status is passed
# back, and the collected logs stay where the simulator put them.
set -euo pipefail
top=$(cd "$(dirname "$0")/.." && pwd)
cd "${top}"
source scripts/packages.sh
source scripts/simulated-device.sh
ensure_packages >&2

cmake --preset dev >/dev/null
cmake --build --preset dev -j "$(nproc)" --target halvextool halvex-sim >/dev/null

run_dir=$(mktemp -d /tmp/halvextool-demo.XXXXXX)
log_root="${run_dir}/device"
trap stop_simulated_device EXIT
start_simulated_device build/dev/sim/halvex-sim scenarios/default.json "${log_root}" \
  "${run_dir}/requests.jsonl"

status=0
build/dev/Tools/HalvexTool/halvextool "$@" || status=$?

echo
echo "The simulated device keeps its files under ${log_root}"
if [[ -d ${log_root} ]] && [[ -n $(find "${log_root}" -mindepth 1 -print -quit) ]]; then
  echo "Collected logs:"
  find "${log_root}" -path '*/log-bb-*' -prune -print | sed "s|^${log_root}|  ${log_root}|"
else
  echo "No logs were collected in this run."
fi
echo "Requests the server received: ${run_dir}/requests.jsonl"
exit "${status}"
