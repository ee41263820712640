#!/usr/bin/env bash
# Builds the whole project with AddressSanitizer and UndefinedBehaviorSanitizer and runs every
# test through ctest.
# Usage: scripts/sanitize-address.sh [build-dir]   (default: build-asan in the repository root)
set -euo pipefail

root="$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)"
build="${1:-$root/build-asan}"

export ASAN_OPTIONS="abort_on_error=1 detect_leaks=1 strict_init_order=1 \
detect_stack_use_after_return=1 ${ASAN_OPTIONS:-}"
export UBSAN_OPTIONS="print_stacktrace=1 halt_on_error=1 ${UBSAN_OPTIONS:-}"

# Debug keeps the debug-only checks (assertions, re-entrancy aborts) in the build under test.
cmake -S "$root" -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=Debug -DCMAKE_CXX_COMPILER=g++ \
  -DLARDER_SANITIZE=address
cmake --build "$build"

# Integration tests talk to a bus of their own.
cd "$build"
dbus-run-session -- ctest --output-on-failure -j2
