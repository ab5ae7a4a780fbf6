#!/usr/bin/env bash
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

source "${top}/scripts/simulated-device.sh"
work=$(mktemp -d /tmp/halvex-tool-startup.XXXXXX)
cleanup() {
  stop_simulated_device
  rm -rf "${work}"
}
trap cleanup EXIT

# The simulator's defaults (server started, baseband logs enabled, mode 0) on a product that
# needs no telephony daemon, so the bench starts no process named like one. The request log goes
# to /dev/null so that disk speed stays out of the measurement.
echo '{"device": {"product_type": 58}}' >"${work}/scenario.json"
start_simulated_device "${sim}" "${work}/scenario.json" "${work}/root" /dev/null

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
