#!/usr/bin/env bash
# SPDX-License-Identifier: MIT
# Runs halvextool against the simulated device on a fresh Debian 12 machine: installs what is
# missing, builds the tool and the simulator, starts a private bus with the device a scenario
# describes (the working device by default), then runs the tool. With no words the tool is
# interactive; words are passed to it as one command line. The tool's exit status is passed back.
# Collected logs stay where the simulator put them; a run that collected nothing leaves nothing.
set -euo pipefail
top=$(cd "$(dirname "$0")/.." && pwd)
cd "${top}"

usage() {
  cat <<EOF
usage: bash scripts/demo.sh [--scenario NAME|FILE] [WORD...]

Runs halvextool against a simulated device. Without WORDs the tool is interactive (type
"help", "logdump tel", "quit"); with WORDs it runs them once, for example:
  bash scripts/demo.sh logdump tel
  bash scripts/demo.sh --scenario helper-fallback logdump bb

Scenarios (NAME is a file of scenarios/ without .json; FILE any scenario file):
EOF
  # One line each, from the simulator's reference, in its order; any other file after those.
  local listed name
  listed=$(sed -n 's/^| `\([A-Za-z0-9_.-]*\)\.json` | \(.*\) |$/\1|\2/p' docs/simulator.md | tr -d '`')
  while IFS='|' read -r name description; do
    [[ -f scenarios/${name}.json ]] && printf '  %-22s %s\n' "${name}" "${description}"
  done <<<"${listed}"
  for name in scenarios/*.json; do
    name=$(basename "${name}" .json)
    grep -q "^${name}|" <<<"${listed}" || printf '  %-22s %s\n' "${name}" "(not described)"
  done
}

scenario=scenarios/default.json
while (($#)); do
  case $1 in
    -h | --help)
      usage
      exit 0
      ;;
    --scenario)
      (($# >= 2)) || { echo "demo.sh: --scenario needs a name or a file" >&2; exit 2; }
      if [[ -f scenarios/$2.json ]]; then
        scenario=scenarios/$2.json
      elif [[ -f $2 ]]; then
        scenario=$2
      else
        echo "demo.sh: no scenario '$2'; see bash scripts/demo.sh --help" >&2
        exit 2
      fi
      shift 2
      ;;
    *) break ;;
  esac
done

source scripts/packages.sh
source scripts/simulated-device.sh
ensure_packages >&2

# The first build takes minutes: show its progress, keep the rest for when it fails.
build_log=$(mktemp /tmp/halvextool-build.XXXXXX)
echo "Building halvextool and halvex-sim in build/dev (full log: ${build_log})" >&2
if ! { cmake --preset dev && cmake --build --preset dev -j "$(nproc)" --target halvextool halvex-sim; } \
  2>&1 | tee "${build_log}" | { grep --line-buffered -E '^\[ *[0-9]+%\]' || true; } >&2; then
  echo "The build failed; its last lines:" >&2
  tail -n 30 "${build_log}" >&2
  exit 1
fi
rm -f "${build_log}"

run_dir=$(mktemp -d /tmp/halvextool-demo.XXXXXX)
log_root="${run_dir}/device"
finish() {
  stop_simulated_device
  local sets=()
  [[ -d ${log_root} ]] && mapfile -t sets < <(find "${log_root}" -name 'log-bb-*' -prune -print | sort)
  echo
  if ((${#sets[@]})); then
    echo "Collected (the tool's paths are under ${log_root}):"
    printf '  %s\n' "${sets[@]}"
    echo "Requests the server received: ${run_dir}/requests.jsonl"
  else
    echo "No logs were collected in this run."
    rm -rf "${run_dir}"
  fi
}
trap finish EXIT
echo "Scenario: ${scenario}" >&2
start_simulated_device build/dev/sim/halvex-sim "${scenario}" "${log_root}" "${run_dir}/requests.jsonl"

status=0
build/dev/Tools/HalvexTool/halvextool "$@" || status=$?
exit "${status}"
