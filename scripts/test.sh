#!/usr/bin/env bash
# Installs what is missing, builds, and runs the whole test suite on a
# private session bus. Usage: scripts/test.sh [build-dir]
# LARDER_BUILD_TYPE picks the CMake build type (RelWithDebInfo unless set).
set -euo pipefail
cd "$(dirname "$0")/.."
build=${1:-build}
./scripts/install-deps.sh
cmake -S . -B "$build" -G Ninja -DCMAKE_BUILD_TYPE="${LARDER_BUILD_TYPE:-RelWithDebInfo}"
cmake --build "$build" -j"$(nproc)"
dbus-run-session -- ctest --test-dir "$build" --output-on-failure -j"$(nproc)"
