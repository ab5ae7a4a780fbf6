#!/usr/bin/env bash
# SPDX-License-Identifier: MIT
# Checks the Debian packages of a built tree (default build/dev) the way a user gets them:
#   1. builds them with cpack (reconfiguring the tree for the prefix /usr if needed) and runs
#      lintian on them (errors fail), lints the manual pages;
#   2. extracts them into a scratch root and checks the service unit and the bash completion;
#   3. builds an outside program against the extracted development package, through
#      find_package(HalvexTrace) and through pkg-config;
#   4. as root: starts a private bus configured like the stock system bus (deny by default) with
#      the extracted policy, and the extracted simulator on it, then shows who may do what:
#      root and the halvexdiag group collect logs, anyone else is refused by the bus and the
#      simulator sees no dump from them; the programs of step 3 ask the device as nobody.
# Everything it starts it stops, and it removes what it created, the halvexdiag group included.
set -euo pipefail
top=$(cd "$(dirname "$0")/.." && pwd)
build=$(cd "${1:-${top}/build/dev}" && pwd)

step() { printf '=== %s\n' "$*"; }
fail() {
  printf 'check-packages: %s\n' "$*" >&2
  exit 1
}

scratch=$(mktemp -d /tmp/halvex-packages.XXXXXX)
chmod 755 "${scratch}"  # the unprivileged runs read the extracted programs
bus_pid="" sim_pid="" created_group=""
cleanup() {
  [[ -n ${sim_pid} ]] && kill "${sim_pid}" 2>/dev/null && wait "${sim_pid}" 2>/dev/null
  [[ -n ${bus_pid} ]] && kill "${bus_pid}" 2>/dev/null
  [[ -n ${created_group} ]] && groupdel "${created_group}"
  rm -rf "${scratch}"
}
trap cleanup EXIT

# --- 1. packages, lintian, manual pages --------------------------------------------------------
prefix=$(sed -n 's/^CMAKE_INSTALL_PREFIX:PATH=//p' "${build}/CMakeCache.txt")
if [[ ${prefix} != /usr ]]; then
  step "reconfiguring ${build} for the prefix /usr (was ${prefix})"
  cmake -S "${top}" -B "${build}" -DCMAKE_INSTALL_PREFIX=/usr >/dev/null
  cmake --build "${build}" -j "$(nproc)" >/dev/null
fi
step "building the packages"
cpack_out=$(cpack -G DEB -B "${scratch}/packages" --config "${build}/CPackConfig.cmake" 2>&1) ||
  fail "cpack failed:"$'\n'"${cpack_out}"
mapfile -t debs < <(find "${scratch}/packages" -maxdepth 1 -name '*.deb' | sort)
((${#debs[@]} == 3)) || fail "expected 3 packages, got: ${debs[*]##*/}"

step "lintian"
lintian_status=0
lintian_out=$(lintian --fail-on error "${debs[@]}" 2>&1) || lintian_status=$?
lintian_out=$(grep -v 'running with root privileges' <<<"${lintian_out}" || true)
((lintian_status == 0)) || fail "lintian reports errors:"$'\n'"${lintian_out}"
printf '%s\n' "${lintian_out:-no errors, no warnings}"

root="${scratch}/root"
for deb in "${debs[@]}"; do dpkg-deb -x "${deb}" "${root}"; done
# One version everywhere: the packages, the program, the pkg-config files.
version=$(dpkg-deb -f "${debs[0]}" Version)
[[ $("${root}/usr/bin/halvex-sim" --version) == "halvex-sim ${version}" ]] ||
  fail "halvex-sim --version does not say ${version}"

step "manual pages"
for page in "${root}"/usr/share/man/man*/*.gz; do
  lint=$(mandoc -T lint "${page}" 2>&1; zcat "${page}" | groff -ww -z -man 2>&1) ||
    fail "${page##*/}: ${lint}"
  [[ -z ${lint} ]] || fail "${page##*/}: ${lint}"
done

# --- 2. service unit, completion ---------------------------------------------------------------
step "service unit"
unit=$(find "${root}" -name halvex-sim.service)
[[ -n ${unit} ]] || fail "no halvex-sim.service in the packages"
grep -qx 'ExecStart=/usr/bin/halvex-sim --log-root /var/lib/halvex-sim' "${unit}" ||
  fail "unexpected ExecStart in ${unit}"
# The unit names /usr/bin/halvex-sim, which is only in the scratch root: verify a copy that
# points there, with the manual pages the unit documents.
sed "s|^ExecStart=/usr/bin/|ExecStart=${root}/usr/bin/|" "${unit}" >"${scratch}/halvex-sim.service"
MANPATH="${root}/usr/share/man" systemd-analyze verify "${scratch}/halvex-sim.service" ||
  fail "systemd-analyze verify failed"

step "bash completion"
bash -c '
  source /usr/share/bash-completion/bash_completion
  source "$1/usr/share/bash-completion/completions/halvextool"
  status=0
  while IFS="|" read -r line expected; do
    read -ra COMP_WORDS <<<"${line}"
    [[ ${line} == *" " ]] && COMP_WORDS+=("")
    COMP_CWORD=$((${#COMP_WORDS[@]} - 1)) COMP_LINE=${line} COMP_POINT=${#line} COMPREPLY=()
    _halvextool halvextool "${COMP_WORDS[COMP_CWORD]}" "${COMP_WORDS[COMP_CWORD - 1]}"
    if [[ "${COMPREPLY[*]}" != "${expected}" ]]; then
      echo "completing [${line}]: got [${COMPREPLY[*]}], expected [${expected}]" >&2
      status=1
    fi
  done <<<"halvextool |logdump cd help back quit exit
halvextool logdump |tel core bb cd help
halvextool logdump tel nonui |nocompress --
halvextool logdump bb |nocompress --
halvextool logdump core why |--
halvextool logdump tel -- logdump c|core cd"
  exit ${status}' bash "${root}" || fail "bash completion"

# --- 3. outside programs against the development package ---------------------------------------
step "outside programs: find_package(HalvexTrace) and pkg-config"
consumer="${top}/tests/trace/consumer"
cmake -S "${consumer}" -B "${scratch}/consumer" -DCMAKE_PREFIX_PATH="${root}/usr" \
  -DCMAKE_FIND_USE_PACKAGE_REGISTRY=OFF -DCMAKE_FIND_USE_SYSTEM_PACKAGE_REGISTRY=OFF >/dev/null
cmake --build "${scratch}/consumer" -j "$(nproc)" >/dev/null
pc_dir=$(dirname "$(find "${root}" -name halvex-trace.pc)")
export PKG_CONFIG_SYSROOT_DIR="${root}"
export PKG_CONFIG_PATH="${pc_dir}"
[[ $(pkg-config --modversion halvex-trace halvex-trace-core) == "${version}"$'\n'"${version}" ]] ||
  fail "the pkg-config files do not say ${version}"
# shellcheck disable=SC2046 # the flags are words
g++ -std=c++20 -o "${scratch}/consumer/pc_bus_consumer" "${consumer}/BusConsumer.cpp" \
  $(pkg-config --cflags --libs halvex-trace)
# shellcheck disable=SC2046
g++ -std=c++20 -o "${scratch}/consumer/pc_consumer" "${consumer}/main.cpp" \
  "${consumer}/HostWithoutRadio.cpp" $(pkg-config --cflags --libs halvex-trace-core)
unset PKG_CONFIG_SYSROOT_DIR PKG_CONFIG_PATH
export LD_LIBRARY_PATH="${pc_dir%/pkgconfig}"
"${scratch}/consumer/trace_consumer"
"${scratch}/consumer/pc_consumer"

if ((EUID != 0)); then
  step "SKIPPED: the bus policy, the simulator and the tool runs need root (not running as root)"
  exit 0
fi

# --- 4. the policy on a stock-like system bus --------------------------------------------------
step "private system bus with the packaged policy"
if ! getent group halvexdiag >/dev/null; then
  systemd-sysusers "${root}/usr/lib/sysusers.d/halvexdiag.conf"
  getent group halvexdiag >/dev/null || fail "the sysusers.d file did not create halvexdiag"
  created_group=halvexdiag
fi
# The stock configuration without what ties it to the machine's own bus (user, fork, pid file,
# socket, included folders), listening in the scratch folder and including the packaged policy.
mkdir "${scratch}/bus"
stock=/usr/share/dbus-1/system.conf
sed -e '/<user>\|<fork\/>\|<pidfile>\|<listen>\|<syslog\/>\|<include[ >]\|<includedir>/d' \
  -e '/<standard_system_servicedirs\/>\|<servicehelper>/d' \
  -e "s|</busconfig>|<listen>unix:path=${scratch}/bus/socket</listen>\n<includedir>${root}/usr/share/dbus-1/system.d</includedir>\n</busconfig>|" \
  "${stock}" >"${scratch}/bus/system.conf"
for rule in '<deny own="\*"/>' '<deny send_type="method_call"/>'; do
  grep -q "${rule}" "${scratch}/bus/system.conf" || fail "${stock} no longer holds ${rule}"
done
dbus-daemon --config-file="${scratch}/bus/system.conf" --fork --print-pid=3 \
  3>"${scratch}/bus/pid" 2> >(grep -v 'Failed to set fd limit' >&2)
bus_pid=$(head -n1 "${scratch}/bus/pid")
export DBUS_SYSTEM_BUS_ADDRESS="unix:path=${scratch}/bus/socket"

nobody=(setpriv --reuid=nobody --regid=nogroup --clear-groups --)
member=(setpriv --reuid=nobody --regid=nogroup --groups=halvexdiag --)
sim=("${root}/usr/bin/halvex-sim" --scenario "${root}/usr/share/halvex-sim/scenarios/default.json")

step "only root owns the names"
if owner_out=$(timeout 10 "${nobody[@]}" "${sim[@]}" 2>&1); then
  fail "the simulator ran as nobody: ${owner_out}"
fi
grep -q 'AccessDenied\|not allowed\|ermission' <<<"${owner_out}" ||
  fail "the simulator as nobody failed for another reason: ${owner_out}"

mkfifo "${scratch}/ready"
"${sim[@]}" --log-root "${scratch}/device" --request-log "${scratch}/requests.jsonl" \
  --ready-fd 3 3>"${scratch}/ready" &
sim_pid=$!
read -r -t 10 ready <"${scratch}/ready" && [[ ${ready} == ready ]] || fail "the simulator did not start"

step "who may call what"
# expect USER ok|denied ARGS...: a busctl call as root, as a halvexdiag member or as nobody.
expect() {
  local who=$1 outcome=$2 out
  shift 2
  local -a as=()
  case ${who} in member) as=("${member[@]}") ;; nobody) as=("${nobody[@]}") ;; esac
  if out=$("${as[@]}" busctl --system "$@" 2>&1); then
    [[ ${outcome} == ok ]] || fail "${who} was allowed: busctl $*"
  else
    [[ ${outcome} == denied && ${out} == *"ccess denied"* ]] ||
      fail "${who}, busctl $*: expected ${outcome}, got: ${out}"
  fi
}
server=(org.halvex.Server /org/halvex/Server org.halvex.Server1)
helper=(org.halvex.Helper /org/halvex/Helper org.halvex.Helper1)
control=(org.halvex.Simulator /org/halvex/Simulator org.halvex.Simulator1)
property=(GetTraceProperty 2 TraceName s SystemLogs TracePropertyName s Mode)
expect nobody ok call "${server[@]}" Subscribe s check
expect nobody ok call org.halvex.Device /org/halvex/Device org.halvex.Device1 GetIdentity
expect nobody ok introspect "${server[0]}" "${server[1]}"
expect nobody denied call "${server[@]}" PerformCommand 'ssa{sv}' check "${property[@]}"
expect nobody denied call "${helper[@]}" Perform 'sisa{sv}' logdump.helper 4 VarniskStatus 0
expect nobody denied call "${control[@]}" EmitState
expect member ok call "${server[@]}" PerformCommand 'ssa{sv}' check "${property[@]}"
expect member ok call "${helper[@]}" Perform 'sisa{sv}' logdump.helper 4 VarniskStatus 0
expect member denied call "${control[@]}" EmitState
expect root ok call "${control[@]}" EmitState

step "halvextool collects logs as root and as a halvexdiag member, not as nobody"
tool="${root}/usr/bin/halvextool"
for who in root member; do
  as=()
  [[ ${who} == member ]] && as=("${member[@]}")
  out=$("${as[@]}" "${tool}" logdump tel) || fail "halvextool as ${who} exited $?: ${out}"
  printf '%s: %s\n' "${who}" "${out//$'\n'/ | }"
  path=$(sed -n 's/^Path = //p' <<<"${out}")
  [[ $(head -n1 <<<"${out}") == "Telephony log collection: Success" && -f ${scratch}/device${path} ]] ||
    fail "halvextool as ${who} did not collect: ${out}"
done
before=$(wc -l <"${scratch}/requests.jsonl")
out=$("${nobody[@]}" "${tool}" logdump tel) || fail "halvextool as nobody exited $?: ${out}"
printf 'nobody: %s\n' "${out//$'\n'/ | }"
[[ ${out} == "Telephony log collection: Failed" ]] || fail "halvextool as nobody: ${out}"
seen=$(tail -n +"$((before + 1))" "${scratch}/requests.jsonl")
grep -q '"method":"Subscribe","client":"halvextool"' <<<"${seen}" ||
  fail "the run as nobody did not reach the simulator"
! grep -q '"method":"PerformCommand"' <<<"${seen}" ||
  fail "a request of nobody's reached the server: ${seen}"

step "outside programs ask the device as nobody"
for program in trace_bus_consumer trace_bus_consumer_static pc_bus_consumer; do
  "${nobody[@]}" "${scratch}/consumer/${program}" RA10 -diag
done
step "packages checked"
