#!/usr/bin/env bash
# Builds the whole project with ThreadSanitizer and runs every test through ctest.
# Usage: scripts/sanitize-thread.sh [build-dir]   (default: build-tsan in the repository root)
set -euo pipefail

root="$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)"
build="${1:-$root/build-tsan}"

# Kernels with many bits of mmap randomisation leave the sanitizer no room for its shadow memory
# ("unexpected memory mapping"). Without randomisation the layout always fits, so turn it off
# wherever the kernel lets us; the test binaries also run during the build, to list their tests.
norandom=()
if setarch "$(uname -m)" -R true 2>/dev/null; then
  norandom=(setarch "$(uname -m)" -R)
fi

export TSAN_OPTIONS="halt_on_error=1 second_deadlock_stack=1 suppressions=$root/scripts/tsan-suppressions.txt ${TSAN_OPTIONS:-}"

# Debug keeps the debug-only checks (assertions, re-entrancy aborts) in the build under test.
cmake -S "$root" -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=Debug -DCMAKE_CXX_COMPILER=g++ \
  -DLARDER_SANITIZE=thread
"${norandom[@]}" cmake --build "$build"

# Integration tests talk to a bus of their own.
cd "$build"
"${norandom[@]}" dbus-run-session -- ctest --output-on-failure -j2
