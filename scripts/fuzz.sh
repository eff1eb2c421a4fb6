#!/usr/bin/env bash
# Builds the libFuzzer targets with clang and runs each for a bounded time; a crash fails.
# Usage: scripts/fuzz.sh [seconds per target]
# Each target gets the seconds asked for ($FUZZ_SECONDS, default 60), but all of them together
# get at most $FUZZ_TOTAL_SECONDS (default 480): with many targets, each runs for less.
set -euo pipefail
cd "$(dirname "$0")/.."
seconds="${1:-${FUZZ_SECONDS:-60}}"
total="${FUZZ_TOTAL_SECONDS:-480}"

scripts/deps.sh
cmake --preset fuzz >/dev/null
cmake --build --preset fuzz -j "$(nproc)"

shopt -s nullglob
targets=(build/fuzz/fuzz/*_fuzz)
if [ "${#targets[@]}" -gt 0 ] && [ $((seconds * ${#targets[@]})) -gt "$total" ]; then
  seconds=$((total / ${#targets[@]}))
  [ "$seconds" -ge 5 ] || seconds=5
fi
found=0
for target in "${targets[@]}"; do
  [ -x "$target" ] || continue
  found=1
  name=$(basename "$target")
  corpus_seed="fuzz/corpus/${name%_fuzz}"
  work=$(mktemp -d)
  seeds=()
  [ -d "$corpus_seed" ] && seeds=("$corpus_seed")
  echo "fuzzing $name for ${seconds}s"
  "$target" -max_total_time="$seconds" -rss_limit_mb=2048 -print_final_stats=1 \
    -artifact_prefix="$work/" "$work" "${seeds[@]}" 2>&1 | tail -n 12
  rm -rf "$work"
done
[ "$found" -eq 1 ] || echo "no fuzz targets built"
