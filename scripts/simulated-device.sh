# SPDX-License-Identifier: MIT
# Starts a private system bus (scripts/private-bus.conf, on ${HALVEX_BUS:-dbus-daemon}) and the
# simulated device for the scripts that source this file. After start_simulated_device SIM_BINARY
# SCENARIO LOG_ROOT REQUEST_LOG: DBUS_SYSTEM_BUS_ADDRESS points at the private bus, and
# stop_simulated_device (run on exit) ends both.
source "$(dirname "${BASH_SOURCE[0]}")/private-bus.sh"

halvex_sim_pid=""
halvex_sim_work=""

stop_simulated_device() {
  [[ -n ${halvex_sim_pid} ]] && kill "${halvex_sim_pid}" 2>/dev/null && wait "${halvex_sim_pid}" 2>/dev/null
  stop_private_bus
  [[ -n ${halvex_sim_work} ]] && rm -rf "${halvex_sim_work}"
  halvex_sim_pid="" halvex_sim_work=""
}

start_simulated_device() {
  local sim=$1 scenario=$2 log_root=$3 request_log=$4 line
  local top
  top=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
  halvex_sim_work=$(mktemp -d /tmp/halvex-bus.XXXXXX)
  chmod 755 "${halvex_sim_work}"  # the bus's socket is for every user
  start_private_bus "${top}/scripts/private-bus.conf" "${halvex_sim_work}/socket" || return 1

  mkfifo "${halvex_sim_work}/ready"
  "${sim}" --scenario "${scenario}" --log-root "${log_root}" --request-log "${request_log}" \
    --ready-fd 5 5>"${halvex_sim_work}/ready" &
  halvex_sim_pid=$!
  if ! read -r -t 10 line <"${halvex_sim_work}/ready" || [[ ${line} != ready ]]; then
    echo "the simulated device did not start" >&2
    stop_simulated_device
    return 1
  fi
}
