#!/usr/bin/env bash
# SPDX-License-Identifier: MIT
# halvextool against the floor of the work it does. Builds optimised copies of the tool, the
# simulator and the reference programs in bench/floor (in build/bench unless BUILD_DIR says
# otherwise), starts a private bus and the simulated device, then, interleaved round by round:
#   - a trivial `int main(){}` (what any process costs here),
#   - halvex-floor: only the bus and /proc work of `logdump tel`, on one thread and one
#     connection, with the same 500 ms wait,
#   - `halvextool logdump tel`,
# and reports the time each spends above the 500 ms wait (median, min, max), their ratio (target
# at most 1.05), peak resident memory (target at most 1.10 of the floor's), and, for a stream of
# interactive `logdump tel` lines through the tool and through the bare client (the floor with
# --lines), the lines each serves per second (target: the tool at least 0.85 of the bare
# client's) and the CPU time each spends per line (target: the tool at most 2.0x). It reports; a
# noisy machine gives noisy figures, not a failure.
#
#   bench/tool-vs-floor.sh [ROUNDS] [LINES] [STREAMS]    defaults: 30 rounds, 2000 lines, 5 streams
set -euo pipefail
top=$(cd "$(dirname "$0")/.." && pwd)
rounds=${1:-30}
lines=${2:-2000}
streams=${3:-5}
build=${BUILD_DIR:-${top}/build/bench}
source "${top}/scripts/packages.sh"
halvex_packages+=(time)
ensure_packages >&2

# As root, a pid namespace of our own: the tool's /proc scan sees only what runs here.
if [[ $(id -u) == 0 && -z ${HALVEX_BENCH_NAMESPACE:-} ]]; then
  exec env HALVEX_BENCH_NAMESPACE=1 unshare --pid --fork --mount-proc bash "$0" "$@"
fi

echo "building (optimised) in ${build} ..." >&2
cmake -S "${top}" -B "${build}" -DCMAKE_BUILD_TYPE=Release -DHALVEX_BUILD_TESTS=OFF >/dev/null
cmake --build "${build}" -j "$(nproc)" --target halvextool halvex-sim halvex-floor halvex-trivial \
  >/dev/null
tool="${build}/Tools/HalvexTool/halvextool"
floor="${build}/bench/floor/halvex-floor"
trivial="${build}/bench/floor/halvex-trivial"

work=$(mktemp -d /tmp/halvex-tool-vs-floor.XXXXXX)
bus_pid="" sim_pid=""
cleanup() {
  [[ -n ${sim_pid} ]] && kill "${sim_pid}" 2>/dev/null && wait "${sim_pid}" 2>/dev/null
  [[ -n ${bus_pid} ]] && kill "${bus_pid}" 2>/dev/null
  rm -rf "${work}"
}
trap cleanup EXIT
dbus-daemon --config-file="${top}/scripts/private-bus.conf" --fork \
  --print-address=3 --print-pid=4 3>"${work}/address" 4>"${work}/pid" 2>/dev/null
bus_pid=$(head -n1 "${work}/pid")
DBUS_SYSTEM_BUS_ADDRESS=$(head -n1 "${work}/address")
export DBUS_SYSTEM_BUS_ADDRESS
# An exempt product, so no daemon-named process is needed; no log root and no request log, so
# that the simulated server's own work stays out of the figures.
echo '{"device": {"product_type": 58}}' >"${work}/scenario.json"
mkfifo "${work}/ready"
"${build}/sim/halvex-sim" --scenario "${work}/scenario.json" --ready-fd 5 5>"${work}/ready" &
sim_pid=$!
if ! read -r -t 10 line <"${work}/ready" || [[ ${line} != ready ]]; then
  echo "halvex-sim did not get ready" >&2
  exit 1
fi

if ! "${tool}" logdump tel >"${work}/first.out" 2>&1 ||
  ! grep -q '^Telephony log collection: Success$' "${work}/first.out"; then
  echo "halvextool logdump tel does not succeed here; nothing to measure" >&2
  exit 1
fi

# Wall time of one run in microseconds.
usec() {
  local start=${EPOCHREALTIME/./}
  "$@" >/dev/null 2>&1 </dev/null || true
  echo $((${EPOCHREALTIME/./} - start))
}

declare -a t_trivial t_floor t_tool
for ((i = 0; i < rounds; i++)); do
  t_trivial+=("$(usec "${trivial}")")
  t_floor+=("$(usec "${floor}")")
  t_tool+=("$(usec "${tool}" logdump tel)")
done

peak() {
  local kb best=0
  for ((i = 0; i < 10; i++)); do
    /usr/bin/time -f '%M' -o "${work}/rss" "$@" >/dev/null 2>&1 </dev/null || true
    kb=$(tail -n1 "${work}/rss")
    ((kb > best)) && best=${kb}
  done
  echo "${best}"
}
rss_floor=$(peak "${floor}")
rss_tool=$(peak "${tool}" logdump tel)

# Interactive throughput and CPU: the same lines through the tool and through the bare client,
# interleaved. A run of one line is taken off each, so that start-up and the 500 ms wait drop out.
# Each measure prints "wall_usec cpu_usec" (CPU: user + system of the process and its children).
for ((i = 0; i < lines; i++)); do echo 'logdump tel'; done >"${work}/lines"
echo 'logdump tel' >"${work}/one"
measure() {  # INPUT PROGRAM [ARGS...]
  local input=$1 t
  shift
  t=$( (
    TIMEFORMAT='%3R %3U %3S'
    time "$@" <"${input}" >/dev/null 2>&1
  ) 2>&1 | tail -n1) || true
  awk '{ printf "%d %d\n", $1 * 1e6, ($2 + $3) * 1e6 }' <<<"${t}"
}
lines_cost() {  # PROGRAM [ARGS...] -> "wall_usec cpu_usec" for lines - 1 lines
  local mw mc ow oc
  read -r mw mc < <(measure "${work}/lines" "$@")
  read -r ow oc < <(measure "${work}/one" "$@")
  echo $((mw - ow)) $((mc - oc))
}
: >"${work}/bare_lines"
: >"${work}/tool_lines"
: >"${work}/bare_cpu"
: >"${work}/tool_cpu"
for ((i = 0; i < streams; i++)); do
  read -r w c < <(lines_cost "${floor}" --lines)
  echo "${w}" >>"${work}/bare_lines"
  echo "${c}" >>"${work}/bare_cpu"
  read -r w c < <(lines_cost "${tool}")
  echo "${w}" >>"${work}/tool_lines"
  echo "${c}" >>"${work}/tool_cpu"
done

printf '%s\n' "${t_trivial[@]}" >"${work}/trivial"
printf '%s\n' "${t_floor[@]}" >"${work}/floor"
printf '%s\n' "${t_tool[@]}" >"${work}/tool"

stats() {  # FILE OFFSET_USEC -> "median min max" in ms
  sort -n "$1" | awk -v off="$2" '{ v[NR] = ($1 - off) / 1000 }
    END { m = (NR % 2) ? v[(NR + 1) / 2] : (v[NR / 2] + v[NR / 2 + 1]) / 2
          printf "%.2f %.2f %.2f\n", m, v[1], v[NR] }'
}
read -r triv_med triv_min triv_max < <(stats "${work}/trivial" 0)
read -r floor_med floor_min floor_max < <(stats "${work}/floor" 500000)
read -r tool_med tool_min tool_max < <(stats "${work}/tool" 500000)
read -r bare_med _ _ < <(stats "${work}/bare_lines" 0)
read -r tlin_med _ _ < <(stats "${work}/tool_lines" 0)
read -r bcpu_med _ _ < <(stats "${work}/bare_cpu" 0)
read -r tcpu_med _ _ < <(stats "${work}/tool_cpu" 0)

awk -v rounds="${rounds}" -v lines="${lines}" \
  -v tm="${triv_med}" -v tn="${triv_min}" -v tx="${triv_max}" \
  -v fm="${floor_med}" -v fn="${floor_min}" -v fx="${floor_max}" \
  -v om="${tool_med}" -v on="${tool_min}" -v ox="${tool_max}" \
  -v rf="${rss_floor}" -v rt="${rss_tool}" -v bl="${bare_med}" -v tl="${tlin_med}" \
  -v bc="${bcpu_med}" -v tc="${tcpu_med}" -v streams="${streams}" 'BEGIN {
  printf "rounds: %d, interleaved; times in ms (median, min, max)\n", rounds
  printf "  int main(){}                  %7.2f %7.2f %7.2f\n", tm, tn, tx
  printf "  floor, above the 500 ms wait  %7.2f %7.2f %7.2f\n", fm, fn, fx
  printf "  tool,  above the 500 ms wait  %7.2f %7.2f %7.2f\n", om, on, ox
  r = om / fm
  printf "one-shot overhead, tool / floor: %.2fx (median; min %.2fx, max %.2fx)  target <= 1.05: %s\n",
         r, on / fn, ox / fx, (r <= 1.05 ? "met" : "missed")
  m = rt / rf
  printf "peak RSS: tool %.2f MiB, floor %.2f MiB: %.2fx  target <= 1.10: %s\n",
         rt / 1024, rf / 1024, m, (m <= 1.10 ? "met" : "missed")
  bps = (lines - 1) / (bl / 1000); tps = (lines - 1) / (tl / 1000)
  bpl = bc * 1000 / (lines - 1); tpl = tc * 1000 / (lines - 1)
  printf "interactive, %d lines x %d streams each (median):\n", lines, streams
  printf "  tool         %6.0f lines/s  %6.1f us CPU/line\n", tps, tpl
  printf "  bare client  %6.0f lines/s  %6.1f us CPU/line\n", bps, bpl
  printf "  rate, tool / bare: %.2f  target >= 0.85: %s\n", tps / bps, (tps / bps >= 0.85 ? "met" : "missed")
  printf "  CPU per line, tool / bare: %.2fx  target <= 2.0: %s\n", tpl / bpl, (tpl / bpl <= 2.0 ? "met" : "missed")
}'
