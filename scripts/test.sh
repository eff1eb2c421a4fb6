#!/usr/bin/env bash
# The test command: installs what is missing, configures, builds and runs every test.
# Usage: scripts/test.sh [preset]   (debug by default; also release, asan, tsan, clang)
set -euo pipefail
cd "$(dirname "$0")/.."
preset="${1:-debug}"

scripts/deps.sh
cmake --preset "$preset" >/dev/null
cmake --build --preset "$preset" -j "$(nproc)"
ctest --preset "$preset" -j "$(nproc)" --timeout 600
