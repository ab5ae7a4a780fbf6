#!/usr/bin/env bash
# SPDX-License-Identifier: MIT
# usage: bash scripts/check-packages.sh [BUILD]
# Checks the Debian packages the way a user gets them. dpkg-buildpackage makes them from a copy of
# this tree (scripts/build-packages.sh) with the distribution's flags, not from a configured build
# tree: BUILD (default build/dev, a release-type build with the project's defaults) serves only to
# show that a build made without Debian's tools gets the same hardening.
#   1. builds the packages twice, in build/package-check/first and .../second, a build's time
#      apart: the .deb files must be byte-identical. The first build is the one checked.
#   2. lintian --pedantic -I shows nothing (a tag that stays carries an override with its
#      reason); the symbols file ships, and the build fails on any symbol it does not list
#      (dpkg-gensymbols at check level 4).
#   3. hardening-check on both programs and both libraries, of the packages and of BUILD, and
#      _FORTIFY_SOURCE on every line that compiled them.
#   4. the libraries' ABI against abi/*.abi (scripts/check-abi.sh), and that check failing on a
#      removed function and a changed return type planted in a scratch copy.
#   5. extracted into a scratch root: manual pages, service unit, bash and zsh completion, outside
#      programs built through find_package(HalvexTrace) and pkg-config.
#   6. as root, with dpkg: install, reinstall, remove and purge; an upgrade from the same tree
#      packaged under a lower version; after each the group exists and the service is neither
#      enabled nor started, and a purge leaves no path behind. With the packages installed, on
#      a private bus configured like the stock system bus with the installed policy, on
#      dbus-daemon and on dbus-broker: root and the halvexdiag group collect logs, anyone else is
#      refused by the bus and the simulator sees no dump of theirs, and the programs of step 5
#      ask the device as nobody. The test bus configuration, scripts/private-bus.conf, serves a
#      collection on both.
# Everything it starts it stops, and it purges what it installed and removes the halvexdiag group
# if it created it, also when a step fails. It will not run over an installation of these
# packages that it did not make.
set -euo pipefail
top=$(cd "$(dirname "$0")/.." && pwd)
build=$(cd "${1:-${top}/build/dev}" && pwd)
packages="${top}/build/package-check"
names=(halvextool libhalvex-trace1 libhalvex-trace-dev)

step() { printf '=== %s\n' "$*"; }
fail() {
  printf 'check-packages: %s\n' "$*" >&2
  exit 1
}
# The state dpkg keeps of a package: "ii" installed, "rc" configuration left, "" none.
state() {
  local abbrev
  abbrev=$(dpkg-query -W -f='${db:Status-Abbrev}' "$1" 2>/dev/null | tr -d ' ') || true
  [[ ${abbrev} == un ]] && abbrev=""
  printf '%s' "${abbrev}"
}

if ((EUID == 0)); then
  for name in "${names[@]}"; do
    [[ -z $(state "${name}") ]] ||
      fail "${name} is on this machine ($(state "${name}")); the check installs and purges it: remove it first"
  done
fi

source "${top}/scripts/packages.sh"
source "${top}/scripts/simulated-device.sh"
scratch=$(mktemp -d /tmp/halvex-packages.XXXXXX)
chmod 755 "${scratch}" # the unprivileged runs read the extracted programs
sim_pid="" installed="" created_group=""
cleanup() {
  [[ -n ${sim_pid} ]] && kill "${sim_pid}" 2>/dev/null && wait "${sim_pid}" 2>/dev/null
  stop_simulated_device
  [[ -n ${installed} ]] && dpkg --purge "${names[@]}" >/dev/null 2>&1
  [[ -n ${created_group} ]] && getent group halvexdiag >/dev/null && groupdel halvexdiag
  rm -rf "${scratch}"
}
trap cleanup EXIT

# --- 1. two builds, byte for byte -------------------------------------------------------------
ensure_build_dependencies "${top}"
export DPKG_GENSYMBOLS_CHECK_LEVEL=4
version=$(dpkg-parsechangelog -l "${top}/debian/changelog" -S Version)
step "building the packages"
bash "${top}/scripts/build-packages.sh" "${packages}/first" >/dev/null
copy="${packages}/first/halvextool-${version}"
mapfile -t debs < <(find "${packages}/first" -maxdepth 1 -name '*.deb' | sort)
((${#debs[@]} == 3)) || fail "expected 3 packages, got: ${debs[*]##*/}"

# --- 2. lintian, symbols -----------------------------------------------------------------------
step "lintian --pedantic -I"
lintian_out=$(lintian --pedantic -I "${debs[@]}" 2>&1 | grep -v 'running with root privileges' || true)
[[ -z ${lintian_out} ]] || fail "lintian reports:"$'\n'"${lintian_out}"
echo "no tags"
step "symbols file"
symbols=$(dpkg-deb --ctrl-tarfile "${packages}/first/libhalvex-trace1_${version}_"*.deb | tar -xOf - ./symbols)
for library in libhalvex-trace.so.1 libhalvex-platform.so.1; do
  grep -q "^${library} libhalvex-trace1 " <<<"${symbols}" || fail "the symbols file lacks ${library}"
done
echo "$(grep -c '^ ' <<<"${symbols}") symbols of both libraries, as debian/libhalvex-trace1.symbols says"

root="${scratch}/root"
for deb in "${debs[@]}"; do dpkg-deb -x "${deb}" "${root}"; done
# One version everywhere: the packages, the program, the pkg-config files.
[[ $(dpkg-deb -f "${debs[0]}" Version) == "${version}" ]] || fail "the packages do not say ${version}"
[[ $("${root}/usr/bin/halvex-sim" --version) == "halvex-sim ${version}" ]] ||
  fail "halvex-sim --version does not say ${version}"

# --- 3. hardening ------------------------------------------------------------------------------
# binaries ARRAY FOLDER: sets ARRAY to the two programs and the two libraries (by their SONAME)
# under FOLDER, in that order.
binaries() {
  local -n found=$1
  local name
  found=()
  for name in halvextool halvex-sim; do
    found+=("$(find "$2" -name "${name}" -type f -perm -u=x -print -quit)")
  done
  for name in libhalvex-trace.so.1 libhalvex-platform.so.1; do
    found+=("$(find "$2" -name "${name}" -print -quit)")
  done
  for name in "${found[@]}"; do [[ -n ${name} ]] || fail "not all four binaries are under $2"; done
}
# cf_protected FILE...: every global function but the C library's start-up code begins with
# endbr64, the mark of -fcf-protection. Debian 12 builds its start-up files without the ELF
# note that says so, and the linker keeps the note only when every input has it, which is why
# hardening-check looks for it in vain on every program of Debian 12.
cf_protected() {
  local file unmarked
  for file; do
    unmarked=$(objdump -d --no-show-raw-insn "${file}" | awk -v globals="$(nm --defined-only -g \
      "${file}" | awk '$2 == "T" {print $3}')" '
      BEGIN { n = split(globals, g, "\n"); for (i = 1; i <= n; i++) global[g[i]] = 1 }
      /^[0-9a-f]+ <[^>]+>:$/ {
        name = substr($2, 2, length($2) - 3)
        getline
        if ((name in global) && name !~ /^_(start|init|fini)$/ && $0 !~ /endbr64/) print name
      }')
    [[ -z ${unmarked} ]] || fail "${file} has functions without control-flow protection:"$'\n'"${unmarked}"
  done
}
harden() {
  local out
  out=$(hardening-check --nocfprotection --nofortify "$@") || fail "hardening-check:"$'\n'"${out}"
  echo "${*##*/}: PIE (programs), stack protector, full RELRO, immediate binding"
}
# fortified WHAT < COMPILE-LINES: every compile line defines _FORTIFY_SOURCE as 2 or more (the last
# word on it that sets or clears it) and optimises, without which glibc checks nothing.
# hardening-check and lintian look for it in the binaries instead: a binary counts as fortified
# when it imports a checked libc call (__snprintf_chk, ...). glibc calls the checked variant only
# where the compiler knows a buffer's size and cannot prove the call fits it, so halvextool and
# libhalvex-platform, whose calls are all proven or of unknown size, import none and would count
# as unfortified however they were built.
fortified() {
  local unfortified
  unfortified=$(awk '
    { level = ""; optimised = 0
      for (i = 1; i <= NF; i++) {
        if ($i ~ /^-U_FORTIFY_SOURCE$/) level = ""
        else if ($i ~ /^-D_FORTIFY_SOURCE=[0-9]+$/) level = substr($i, 19) + 0
        else if ($i ~ /^-O[1-3s]?$/) optimised = 1
        else if ($i == "-O0") optimised = 0
      }
      n++
      if (level == "" || level < 2 || !optimised) print
    }
    END { if (n == 0) print "no compile lines found" }')
  [[ -z ${unfortified} ]] ||
    fail "$1: compiled without _FORTIFY_SOURCE=2 or without optimisation:"$'\n'"${unfortified}"
  echo "$1: every source compiled with _FORTIFY_SOURCE=2 or more, optimised"
}
step "hardening: the packages"
packaged=() unstripped=() own=()
binaries packaged "${root}"
harden "${packaged[@]}"
grep -E '^(cd [^ ]+ && )?/usr/bin/c\+\+ .* -c ' "${packages}/first/build.log" | fortified "the packages"
binaries unstripped "${copy}/obj-$(dpkg-architecture -qDEB_HOST_GNU_TYPE)"
cf_protected "${unstripped[@]}"
echo "control-flow protection: every function begins with endbr64"
step "hardening: ${build}, built without Debian's flags"
binaries own "${build}"
harden "${own[@]}"
sed -n 's/^ *"command": "\(.*\)",$/\1/p' "${build}/compile_commands.json" | fortified "${build}"
cf_protected "${own[@]}"

# --- 4. ABI ------------------------------------------------------------------------------------
step "ABI against abi/"
headers="${copy}/debian/tmp/usr/include/halvex"
bash "${top}/scripts/check-abi.sh" "${headers}" "${unstripped[@]:2}"
echo "both libraries offer the ABI of their baselines"
step "ABI check on planted breaks"
planted="${scratch}/planted"
mkdir "${planted}"
tar -C "${copy}" --exclude='./obj-*' --exclude=./debian -cf - . | tar -xf - -C "${planted}"
sed -i 's/isKernelPCITraceSupported/isKernelPCITraceSupportedGone/' \
  "${planted}/trace/src/TraceCatalog.cpp" "${planted}/trace/include/halvex/trace/TraceCatalog.h"
sed -i 's/^bool getShouldAlwaysFilter()/int getShouldAlwaysFilter()/' \
  "${planted}/trace/src/DiagConfig.cpp" "${planted}/trace/include/halvex/trace/DiagConfig.h"
planted_lines=$(cat "${planted}"/trace/src/*.cpp |
  grep -c 'isKernelPCITraceSupportedGone\|^int getShouldAlwaysFilter')
((planted_lines == 2)) || fail "the planted breaks no longer apply to trace/src"
(
  eval "$(DEB_BUILD_MAINT_OPTIONS=hardening=+all dpkg-buildflags --export=sh)"
  # shellcheck disable=SC2153 # dpkg-buildflags set it
  export CXXFLAGS="${CXXFLAGS} ${CPPFLAGS}"
  cmake -S "${planted}" -B "${planted}/obj" -DCMAKE_BUILD_TYPE=None -DHALVEX_HARDENING=OFF \
    -DHALVEX_BUILD_TESTS=OFF -DHALVEX_BUILD_BENCH=OFF -DHALVEX_INSTALL=OFF >/dev/null
  cmake --build "${planted}/obj" -j "$(nproc)" --target halvex_trace_shared >/dev/null
)
if report=$(bash "${top}/scripts/check-abi.sh" "${headers}" \
  "$(find "${planted}/obj" -name libhalvex-trace.so.1 -print -quit)" 2>&1); then
  fail "the ABI check passed a removed function and a changed return type"
fi
for expected in "Removed function" "isKernelPCITraceSupported()" "getShouldAlwaysFilter()" \
  "return type changed" "needs a new SONAME"; do
  [[ ${report} == *"${expected}"* ]] || fail "the ABI check's report does not say ${expected}:"$'\n'"${report}"
done
echo "refused, naming both:"
grep -E "\[D\]|\[C\]|type name changed" <<<"${report}" | sed 's/^ */  /'

# --- 1, continued: the second build ------------------------------------------------------------
step "building the packages again, in another folder"
bash "${top}/scripts/build-packages.sh" "${packages}/second" >/dev/null
for deb in "${debs[@]}"; do
  cmp -s "${deb}" "${packages}/second/${deb##*/}" ||
    fail "${deb##*/} differs between ${packages}/first and ${packages}/second"
done
[[ $(find "${packages}/second" -maxdepth 1 -name '*.deb' | wc -l) == 3 ]] ||
  fail "the second build made other packages"
sha256sum "${debs[@]}" | sed "s|${packages}/first/||"
echo "identical in both builds"

# --- 5. the extracted packages ----------------------------------------------------------------
step "manual pages"
for page in "${root}"/usr/share/man/man*/*.gz; do
  lint=$(mandoc -T lint "${page}" 2>&1; zcat "${page}" | groff -ww -z -man 2>&1) ||
    fail "${page##*/}: ${lint}"
  [[ -z ${lint} ]] || fail "${page##*/}: ${lint}"
done

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

# Completion cases: a command line and the words each shell must offer after it, in any order.
halvextool_cases="halvextool |logdump cd help back quit exit
halvextool logdump |tel core bb cd help
halvextool logdump tel nonui |nocompress --
halvextool logdump bb |nocompress --
halvextool logdump core why |--
halvextool logdump tel -- logdump c|core cd"

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
  done <<<"$2"
  exit ${status}' bash "${root}" "${halvextool_cases}" || fail "bash completion"

step "zsh completion"
# halvex-sim's file arguments complete in a folder with a scenario, another file and a folder.
mkdir -p "${scratch}/files/logs"
touch "${scratch}/files/device.json" "${scratch}/files/notes.txt"
zsh_cases="${halvextool_cases}
halvex-sim --|--help --version --scenario --request-log --log-root --ready-fd
halvex-sim --scenario |device.json logs
halvex-sim --log-root=|logs
halvex-sim --help |"
mapfile -t lines < <(cut -d'|' -f1 <<<"${zsh_cases}")
got=$(cd "${scratch}/files" && timeout 30 zsh -f "${top}/scripts/zsh-complete.zsh" \
  "${root}/usr/share/zsh/vendor-completions" "${lines[@]}") || fail "zsh did not complete"
words() { tr ' ' '\n' <<<"$1" | sort -u | paste -sd ' '; }
while IFS='|' read -r line expected; do
  IFS='|' read -r typed offered <&3 || fail "zsh gave no answer for [${line}]"
  [[ ${typed} == "${line}" && $(words "${offered}") == "$(words "${expected}")" ]] ||
    fail "zsh completing [${line}]: got [${offered}], expected [${expected}]"
done <<<"${zsh_cases}" 3<<<"${got}"

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
  step "SKIPPED: installing, the bus policy and the tool runs need root (not running as root)"
  exit 0
fi

# --- 6. install, upgrade, remove, purge ----------------------------------------------------------
# The older version: the second build's tree packaged again under a lower version, reusing its
# compiled objects. What an upgrade exercises is the packaging (maintainer scripts, the unit's
# and the group's handling, files replaced), which the two versions share.
previous="${version}~previous"
step "packaging the same tree as ${previous}"
(
  cd "${packages}/second/halvextool-${version}"
  sed -i "1s/(${version})/(${previous})/" debian/changelog
  dpkg-buildpackage -us -uc -b -nc >"${packages}/second/previous.log" 2>&1
) || fail "packaging ${previous} failed; see ${packages}/second/previous.log"
mapfile -t previous_debs < <(find "${packages}/second" -maxdepth 1 -name "*_${previous}_*.deb" | sort)
((${#previous_debs[@]} == 3)) || fail "expected 3 packages of ${previous}, got: ${previous_debs[*]##*/}"

getent group halvexdiag >/dev/null || created_group=halvexdiag
# paths: what exists where packages put files and their scripts keep state (dpkg's own database
# aside, which the package states below cover).
paths() { find /etc /lib /usr /var/lib -xdev -path /var/lib/dpkg -prune -o -print | sort; }
paths >"${scratch}/paths.before"
# dpkg_do WHAT ARGS...: runs dpkg, its output kept for a failure.
dpkg_do() {
  local what=$1 out
  shift
  out=$(dpkg "$@" 2>&1) || fail "dpkg ${what} failed:"$'\n'"${out}"
}
# installed_as VERSION: all three packages installed at VERSION, the group there, the service
# unit installed but neither enabled nor running.
installed_as() {
  local name
  for name in "${names[@]}"; do
    [[ $(state "${name}") == ii && $(dpkg-query -W -f='${Version}' "${name}") == "$1" ]] ||
      fail "${name} is not installed at $1 ($(state "${name}"))"
  done
  getent group halvexdiag >/dev/null || fail "no halvexdiag group after installing"
  [[ -f /lib/systemd/system/halvex-sim.service ]] || fail "the service unit is not installed"
  [[ $(systemctl is-enabled halvex-sim.service 2>&1) == disabled ]] ||
    fail "the package enabled halvex-sim: $(systemctl is-enabled halvex-sim.service 2>&1)"
  if [[ -d /run/systemd/system ]] && systemctl --quiet is-active halvex-sim.service; then
    fail "the package started halvex-sim"
  fi
  ! pidof /usr/bin/halvex-sim >/dev/null || fail "halvex-sim runs after installing"
}
# purged: no state left with dpkg, and no path that was not there before.
purged() {
  local name left
  for name in "${names[@]}"; do
    [[ -z $(state "${name}") ]] || fail "${name} left: $(state "${name}")"
  done
  left=$(paths | comm -13 "${scratch}/paths.before" -)
  [[ -z ${left} ]] || fail "purging left behind:"$'\n'"${left}"
}

step "install ${version}, reinstall, remove, purge"
installed=yes
dpkg_do install --install "${debs[@]}"
installed_as "${version}"
dpkg_do reinstall --install "${debs[@]}"
installed_as "${version}"
conffiles=$(dpkg-query -W -f='${Conffiles}\n' "${names[@]}" | awk 'NF {print $1}')
dpkg_do remove --remove "${names[@]}"
for name in "${names[@]}"; do
  [[ $(state "${name}") == rc || $(state "${name}") == "" ]] || fail "${name} after removing: $(state "${name}")"
done
[[ ! -e /usr/bin/halvextool && ! -e /usr/share/dbus-1/system.d/org.halvex.conf ]] ||
  fail "removing left the program or the policy"
for file in ${conffiles}; do [[ -e ${file} ]] || fail "removing took the configuration ${file}"; done
dpkg_do purge --purge "${names[@]}"
purged
echo "installed, reinstalled, removed (configuration kept: ${conffiles:-none}), purged: nothing left"

step "install ${previous}, upgrade to ${version}"
dpkg_do install --install "${previous_debs[@]}"
installed_as "${previous}"
dpkg_do upgrade --install "${debs[@]}"
installed_as "${version}"
echo "upgraded; the group is there, the service neither enabled nor running"

# --- 6, continued: the installed policy on a stock-like system bus -----------------------------
# The stock configuration without what ties it to the machine's own bus (user, fork, pid file,
# socket, syslog, activation), with the installed policies. dbus-daemon wants a <listen>, which
# start_private_bus overrides.
stock=/usr/share/dbus-1/system.conf
sed -e '/<user>\|<fork\/>\|<pidfile>\|<listen>\|<syslog\/>\|<include[ >]\|<includedir>/d' \
  -e '/<standard_system_servicedirs\/>\|<servicehelper>/d' \
  -e "s|</busconfig>|<listen>unix:tmpdir=/tmp</listen>\n<includedir>/usr/share/dbus-1/system.d</includedir>\n<includedir>/etc/dbus-1/system.d</includedir>\n</busconfig>|" \
  "${stock}" >"${scratch}/system.conf"
for rule in '<deny own="\*"/>' '<deny send_type="method_call"/>'; do
  grep -q "${rule}" "${scratch}/system.conf" || fail "${stock} no longer holds ${rule}"
done

nobody=(setpriv --reuid=nobody --regid=nogroup --clear-groups --)
member=(setpriv --reuid=nobody --regid=nogroup --groups=halvexdiag --)
sim=(/usr/bin/halvex-sim --scenario /usr/share/halvex-sim/scenarios/default.json)
server=(org.halvex.Server /org/halvex/Server org.halvex.Server1)
helper=(org.halvex.Helper /org/halvex/Helper org.halvex.Helper1)
control=(org.halvex.Simulator /org/halvex/Simulator org.halvex.Simulator1)
property=(GetTraceProperty 2 TraceName s SystemLogs TracePropertyName s Mode)

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

for bus in dbus-daemon dbus-broker; do
  step "${bus}: the installed policy on a stock-like system bus"
  mkdir "${scratch}/${bus}"
  start_private_bus "${scratch}/system.conf" "${scratch}/${bus}/socket" "${bus}"

  if owner_out=$(timeout 10 "${nobody[@]}" "${sim[@]}" 2>&1); then
    fail "the simulator ran as nobody: ${owner_out}"
  fi
  grep -q 'AccessDenied\|not allowed\|ermission\|refused by policy' <<<"${owner_out}" ||
    fail "the simulator as nobody failed for another reason: ${owner_out}"
  echo "only root owns the names"

  mkfifo "${scratch}/${bus}/ready"
  "${sim[@]}" --log-root "${scratch}/${bus}/device" --request-log "${scratch}/${bus}/requests.jsonl" \
    --ready-fd 3 3>"${scratch}/${bus}/ready" &
  sim_pid=$!
  if ! read -r -t 10 ready <"${scratch}/${bus}/ready" || [[ ${ready} != ready ]]; then
    fail "the simulator did not start"
  fi

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
  echo "who may call what: as the policy says"

  for who in root member; do
    as=()
    [[ ${who} == member ]] && as=("${member[@]}")
    out=$("${as[@]}" /usr/bin/halvextool logdump tel) || fail "halvextool as ${who} exited $?: ${out}"
    printf '%s: %s\n' "${who}" "${out//$'\n'/ | }"
    path=$(sed -n 's/^Path = //p' <<<"${out}")
    [[ $(head -n1 <<<"${out}") == "Telephony log collection: Success" && -f ${scratch}/${bus}/device${path} ]] ||
      fail "halvextool as ${who} did not collect: ${out}"
  done
  before=$(wc -l <"${scratch}/${bus}/requests.jsonl")
  out=$("${nobody[@]}" /usr/bin/halvextool logdump tel) || fail "halvextool as nobody exited $?: ${out}"
  printf 'nobody: %s\n' "${out//$'\n'/ | }"
  [[ ${out} == "Telephony log collection: Failed" ]] || fail "halvextool as nobody: ${out}"
  seen=$(tail -n +"$((before + 1))" "${scratch}/${bus}/requests.jsonl")
  grep -q '"method":"Subscribe","client":"halvextool"' <<<"${seen}" ||
    fail "the run as nobody did not reach the simulator"
  ! grep -q '"method":"PerformCommand"' <<<"${seen}" ||
    fail "a request of nobody's reached the server: ${seen}"

  for program in trace_bus_consumer trace_bus_consumer_static pc_bus_consumer; do
    "${nobody[@]}" "${scratch}/consumer/${program}" RA10 -diag >/dev/null
  done
  echo "outside programs asked the device as nobody"
  kill "${sim_pid}"
  wait "${sim_pid}" 2>/dev/null || true
  sim_pid=""
  stop_private_bus
done

for bus in dbus-daemon dbus-broker; do
  step "${bus}: the test bus (scripts/private-bus.conf)"
  HALVEX_BUS=${bus} start_simulated_device /usr/bin/halvex-sim \
    /usr/share/halvex-sim/scenarios/default.json "${scratch}/test-${bus}" "${scratch}/test-${bus}.jsonl"
  out=$("${nobody[@]}" /usr/bin/halvextool logdump tel) || fail "halvextool on ${bus} exited $?: ${out}"
  [[ $(head -n1 <<<"${out}") == "Telephony log collection: Success" ]] ||
    fail "halvextool on the test bus of ${bus}: ${out}"
  echo "nobody collects, as the test bus lets anyone"
  stop_simulated_device
done

step "remove and purge ${version}"
dpkg_do purge --purge "${names[@]}"
installed=""
purged
echo "nothing left"
step "packages checked"
