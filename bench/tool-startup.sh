#!/usr/bin/env bash
# SPDX-License-Identifier: MIT
# Start-up cost of halvextool: times one-shot `halvextool logdump tel` against the simulated
# device and reports how far the median run lies above the tool's 500 ms wait for the server's
# state (target: under 10 ms), and the peak resident memory of a run.
#
#   bench/tool-startup.sh BUILD_DIR [RUNS]
#
# Builds nothing: BUILD_DIR must already hold Tools/HalvexTool/halvextool and sim/halvex-sim
# (an optimised build measures what ships). RUNS defaults to 30.
set -euo pipefail
top=$(cd "$(dirname "$0")/.." && pwd)
if (($# < 1)); then
  sed -n '2,9s/^# \{0,1\}//p' "$0" >&2
  exit 2
fi
build=$(cd "$1" && pwd)
runs=${2:-30}
tool="${build}/Tools/HalvexTool/halvextool"
sim="${build}/sim/halvex-sim"
for program in "${tool}" "${sim}"; do
  [[ -x ${program} ]] || { echo "missing ${program}: build it first" >&2; exit 2; }
done
for command in hyperfine jq /usr/bin/time; do
  command -v "${command}" >/dev/null || { echo "needs ${command}" >&2; exit 2; }
done

work=$(mktemp -d /tmp/halvex-tool-startup.XXXXXX)
bus_pid="" sim_pid=""
cleanup() {
  [[ -n ${sim_pid} ]] && kill "${sim_pid}" 2>/dev/null && wait "${sim_pid}" 2>/dev/null
  [[ -n ${bus_pid} ]] && kill "${bus_pid}" 2>/dev/null
  rm -rf "${work}"
}
trap cleanup EXIT

# A private system bus, as the demo uses.
dbus-daemon --config-file="${top}/scripts/private-bus.conf" --fork \
  --print-address=3 --print-pid=4 3>"${work}/address" 4>"${work}/pid" 2>/dev/null
bus_pid=$(head -n1 "${work}/pid")
DBUS_SYSTEM_BUS_ADDRESS=$(head -n1 "${work}/address")
export DBUS_SYSTEM_BUS_ADDRESS

# The simulator's defaults (server started, baseband logs enabled, mode 0) on a product that
# needs no telephony daemon, so the bench starts no process named like one. No log root: writing
# real log sets is the simulated server's work, not the tool's, and would swamp what is measured;
# the request log goes to /dev/null for the same reason.
echo '{"device": {"product_type": 58}}' >"${work}/scenario.json"
mkfifo "${work}/ready"
"${sim}" --scenario "${work}/scenario.json" --request-log /dev/null --ready-fd 5 \
  5>"${work}/ready" &
sim_pid=$!
if ! read -r -t 10 line <"${work}/ready" || [[ ${line} != ready ]]; then
  echo "halvex-sim did not get ready" >&2
  exit 1
fi

# A run that does not collect would measure the wrong thing.
if ! "${tool}" logdump tel >"${work}/first.out" 2>&1 ||
  ! grep -q '^Telephony log collection: Success$' "${work}/first.out"; then
  echo "halvextool logdump tel did not succeed:" >&2
  cat "${work}/first.out" >&2
  exit 1
fi

hyperfine --shell=none --warmup 2 --runs "${runs}" --style basic \
  --export-json "${work}/times.json" "${tool} logdump tel" >&2

peak_kb=0
for ((i = 0; i < 10; i++)); do
  /usr/bin/time -f '%M' -o "${work}/rss" "${tool}" logdump tel >/dev/null
  kb=$(tail -n1 "${work}/rss")
  ((kb > peak_kb)) && peak_kb=${kb}
done

median_s=$(jq '.results[0].median' "${work}/times.json")
awk -v median="${median_s}" -v runs="${runs}" -v kb="${peak_kb}" 'BEGIN {
  overhead = median * 1000 - 500
  printf "runs:                  %d\n", runs
  printf "median wall time:      %.1f ms\n", median * 1000
  printf "overhead above 500 ms: %.1f ms (target < 10 ms: %s)\n", overhead,
         overhead < 10 ? "met" : "MISSED"
  printf "peak resident memory:  %.1f MiB (%d KiB)\n", kb / 1024, kb
}'
