# SPDX-License-Identifier: MIT
# Debian packages the build, the tests and the demo need. Sourced by the other scripts.
# clang and libclang-rt-14-dev (sanitizer runtimes and libFuzzer) serve the clang and fuzz presets;
# dpkg-dev, file, lintian, mandoc and groff-base the package check.
halvex_packages=(cmake make g++ clang libclang-rt-14-dev pkgconf libgtest-dev libgmock-dev
  libbenchmark-dev libsystemd-dev nlohmann-json3-dev dbus-daemon systemd tar gzip util-linux
  procps mandoc dpkg-dev file lintian groff-base bash-completion dbus-system-bus-common)

ensure_packages() {
  local missing=() p
  for p in "${halvex_packages[@]}"; do
    dpkg-query -W -f='${Status}' "${p}" 2>/dev/null | grep -q 'install ok installed' || missing+=("${p}")
  done
  ((${#missing[@]})) || return 0
  echo "installing: ${missing[*]}"
  export DEBIAN_FRONTEND=noninteractive
  apt-get update
  apt-get install -y --no-install-recommends "${missing[@]}" </dev/null
}
