#!/usr/bin/env bash
# Installs the Debian packages that larder builds, tests and benchmarks with.
# Safe to run again: apt-get skips what is already installed.
set -euo pipefail

packages=(
  build-essential cmake ninja-build pkg-config git
  libplist++-dev libplist-dev zlib1g-dev libcurl4-openssl-dev libssl-dev libarchive-dev
  libsdbus-c++-dev libsdbus-c++-bin libsystemd-dev dbus
  libcpp-httplib-dev libcli11-dev nlohmann-json3-dev uuid-dev
  libgtest-dev libgmock-dev libbenchmark-dev
  clang libclang-rt-14-dev llvm clang-format clang-tidy
  procps curl
  xvfb xauth dunst
)

missing=()
for p in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done

if [ ${#missing[@]} -eq 0 ]; then
  echo "install-deps: everything is installed"
  exit 0
fi

sudo_cmd=()
[ "$(id -u)" -eq 0 ] || sudo_cmd=(sudo)
export DEBIAN_FRONTEND=noninteractive
"${sudo_cmd[@]}" apt-get update -qq
"${sudo_cmd[@]}" apt-get install -y -qq --no-install-recommends "${missing[@]}"
