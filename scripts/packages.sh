# SPDX-License-Identifier: MIT
# Debian packages the build, the tests and the demo need. Sourced by the other scripts.
# clang and libclang-rt-14-dev (sanitizer runtimes and libFuzzer) serve the clang and fuzz presets;
# clang-tidy-14 scripts/tidy.sh; clang-format-15 (the first with InsertBraces)
# scripts/check-format.sh; dpkg-dev, file, lintian, mandoc, groff-base, devscripts
# (hardening-check), abigail-tools, zsh and dbus-broker the package check, whose package build
# brings what debian/control asks for (ensure_build_dependencies).
halvex_packages=(cmake make g++ clang libclang-rt-14-dev clang-tidy-14 clang-format-15 pkgconf
  libgtest-dev libgmock-dev libbenchmark-dev libsystemd-dev nlohmann-json3-dev dbus-daemon systemd
  tar gzip util-linux procps mandoc dpkg-dev file lintian groff-base bash-completion
  dbus-system-bus-common devscripts abigail-tools zsh dbus-broker)

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
  # Installing dbus-broker makes it the machine's system and session bus from the next boot on;
  # the tests only start it themselves, so the machine keeps the bus it had.
  if [[ " ${missing[*]} " == *" dbus-broker "* ]]; then
    systemctl disable dbus-broker.service
    systemctl --global disable dbus-broker.service
  fi
}

# What debian/control says the package build needs, installed the way a packager would.
ensure_build_dependencies() {
  dpkg-checkbuilddeps "$1/debian/control" 2>/dev/null && return 0
  echo "installing the package build's dependencies (debian/control)"
  export DEBIAN_FRONTEND=noninteractive
  apt-get update
  apt-get build-dep -y --no-install-recommends "$1/" </dev/null
}
