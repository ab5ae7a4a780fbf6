# SPDX-License-Identifier: MIT
# shellcheck shell=bash
# A throw-away bus for the scripts that source this file, on dbus-daemon or dbus-broker.
#   start_private_bus CONFIG SOCKET [dbus-daemon|dbus-broker]
#     starts a bus configured by CONFIG listening on the unix socket SOCKET (the configuration's
#     own <listen> is not used), exports DBUS_SYSTEM_BUS_ADDRESS and sets halvex_bus_pid. The
#     implementation defaults to ${HALVEX_BUS:-dbus-daemon}.
#   stop_private_bus
#     ends it (run it on exit).

halvex_bus_pid=""
halvex_bus_kind=""

stop_private_bus() {
  if [[ -n ${halvex_bus_pid} ]]; then
    # The broker runs in a process group of its own, with its launcher and its journal sink.
    if [[ ${halvex_bus_kind} == dbus-broker ]]; then
      kill -- -"${halvex_bus_pid}" 2>/dev/null
    else
      kill "${halvex_bus_pid}" 2>/dev/null
    fi
  fi
  halvex_bus_pid="" halvex_bus_kind=""
}

start_private_bus() {
  local config=$1 socket=$2 kind=${3:-${HALVEX_BUS:-dbus-daemon}} i
  rm -f "${socket}"
  export DBUS_SYSTEM_BUS_ADDRESS="unix:path=${socket}"
  case ${kind} in
    dbus-daemon)
      dbus-daemon --config-file="${config}" --address="${DBUS_SYSTEM_BUS_ADDRESS}" --fork \
        --print-pid=3 3>"${socket}.pid" 2> >(grep -v 'Failed to set fd limit' >&2) || return 1
      halvex_bus_pid=$(head -n1 "${socket}.pid")
      ;;
    dbus-broker)
      # The launcher takes its socket from socket activation and starts at the first connection;
      # it connects to its own bus as a client. It logs only to the journal and gives up without
      # one, so where no journald runs it gets a sink of its own, in a mount namespace of its own.
      local -a launch=(systemd-socket-activate -E "DBUS_SYSTEM_BUS_ADDRESS=${DBUS_SYSTEM_BUS_ADDRESS}"
        -l "${socket}" dbus-broker-launch --scope system --config-file "${config}")
      if [[ -S /run/systemd/journal/socket ]]; then
        setsid "${launch[@]}" >"${socket}.log" 2>&1 &
      else
        (exec setsid unshare --mount --propagation private sh -c '
          run=/run/systemd
          [ -d "${run}" ] || run=/run
          mount -t tmpfs -o mode=755 halvex-journal "${run}" && mkdir -p /run/systemd/journal || exit 1
          perl -MIO::Socket::UNIX -e "my \$s = IO::Socket::UNIX->new(Type => SOCK_DGRAM, Local => shift)
            or die qq(journal sink: \$!\n); my \$m; 1 while defined \$s->recv(\$m, 65536)" \
            /run/systemd/journal/socket &
          while [ ! -S /run/systemd/journal/socket ]; do sleep 0.05; done
          exec "$@"' sh "${launch[@]}") >"${socket}.log" 2>&1 &
      fi
      halvex_bus_pid=$!
      # systemd-socket-activate makes the socket for its owner alone; the bus is for every user.
      for ((i = 0; i < 100; i++)); do
        [[ -S ${socket} ]] && break
        sleep 0.05
      done
      chmod 666 "${socket}" 2>/dev/null || true
      ;;
    *)
      echo "start_private_bus: no bus implementation ${kind}" >&2
      return 1
      ;;
  esac
  halvex_bus_kind=${kind}
  for ((i = 0; i < 100; i++)); do
    busctl --system call org.freedesktop.DBus /org/freedesktop/DBus org.freedesktop.DBus GetId \
      >/dev/null 2>&1 && return 0
    sleep 0.1
  done
  echo "start_private_bus: ${kind} did not start with ${config}" >&2
  [[ -f ${socket}.log ]] && cat "${socket}.log" >&2
  stop_private_bus
  return 1
}
