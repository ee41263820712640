#!/usr/bin/env bash
# Builds every libFuzzer target with clang under ASan/UBSan and runs each
# over its corpus for a bounded time; the build is also the lock-annotation
# check. Usage: scripts/fuzz.sh [seconds-per-target] [build-dir]
# LARDER_BUILD_TYPE picks the CMake build type (RelWithDebInfo unless set).
set -euo pipefail
cd "$(dirname "$0")/.."
seconds=${1:-60}
build=${2:-build-fuzz}
./scripts/install-deps.sh
cmake -S . -B "$build" -G Ninja -DCMAKE_CXX_COMPILER=clang++ -DCMAKE_BUILD_TYPE="${LARDER_BUILD_TYPE:-RelWithDebInfo}" \
  -DLARDER_FUZZ=ON -DLARDER_SANITIZE=address -DLARDER_TESTS=OFF -DLARDER_BENCH=OFF
# clang also checks the lock annotations here (-Wthread-safety is an error),
# so the tools are built too: everything with a lock is compiled by clang.
cmake --build "$build" -j"$(nproc)" --target larder_fuzzers larderctl larder-store
# The DMAP seeds as the current document builder writes them, beside the
# committed ones.
fresh_dmap_seeds="$build/fuzz/seeds/dmap"
"$build/fuzz/dmap_seed_writer" "$fresh_dmap_seeds"
for target in "$build"/fuzz/fuzz_*; do
  [ -x "$target" ] || continue
  name=$(basename "$target")
  # fuzz_platform_plist reads fuzz/corpus/plist, fuzz_dmap_decode fuzz/corpus/dmap.
  subject="${name#fuzz_}"
  subject="${subject#platform_}"
  corpus="fuzz/corpus/${subject%%_*}"
  work=$(mktemp -d)
  seeds=()
  [ -d "$corpus" ] && seeds=("$corpus")
  [ "$corpus" = fuzz/corpus/dmap ] && seeds+=("$fresh_dmap_seeds")
  echo "== $name for ${seconds}s (seeds: ${seeds[*]:-none})"
  "$target" -max_total_time="$seconds" -timeout=10 -rss_limit_mb=4096 -print_final_stats=1 \
    "$work" "${seeds[@]}" 2>&1 | tail -n 12
  rm -rf "$work"
done
