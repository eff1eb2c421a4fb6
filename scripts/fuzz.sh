#!/usr/bin/env bash
# Builds the libFuzzer targets with clang and runs each for a bounded time; a crash fails.
# Usage: scripts/fuzz.sh [seconds per target]
set -euo pipefail
cd "$(dirname "$0")/.."
seconds="${1:-60}"

scripts/deps.sh
cmake --preset fuzz >/dev/null
cmake --build --preset fuzz -j "$(nproc)"

shopt -s nullglob
found=0
for target in build/fuzz/fuzz/*_fuzz; do
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
