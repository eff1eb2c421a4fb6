#!/usr/bin/env bash
# Fails when an include under src/ points up the floor plan (docs/ARCHITECTURE.md): base folders
# (fd, value, log, dispatch) -> ipc -> services and storage -> linux -> the daemon's subsystems.
# Only the daemon's main() names the Linux platform from above it.
set -euo pipefail
cd "$(dirname "$0")/../src"

rank() {
  case "$1" in
    platform/fd/*) echo 0 ;;
    platform/value/*) echo 1 ;;
    platform/log/*) echo 2 ;;
    platform/dispatch/*) echo 3 ;;
    platform/ipc/*) echo 4 ;;
    platform/services/* | platform/storage/*) echo 5 ;;
    platform/platform.h) echo 6 ;;
    platform/linux/*) echo 7 ;;
    *) echo 8 ;;
  esac
}

bad=0
while IFS= read -r file; do
  from=$(rank "$file")
  while IFS= read -r included; do
    to=$(rank "$included")
    if [ "$to" -gt "$from" ] && [ "$file" != daemon/main.cc ]; then
      echo "layering: $file includes $included" >&2
      bad=1
    fi
    if [ "$from" -eq 8 ] && [ "$to" -eq 7 ] && [ "$file" != daemon/main.cc ]; then
      echo "layering: $file names the Linux platform ($included)" >&2
      bad=1
    fi
  done < <(sed -n 's/^#include "\([^"]*\)".*/\1/p' "$file")
done < <(find . -name '*.h' -o -name '*.cc' | sed 's#^\./##' | sort)
if [ "$bad" -ne 0 ]; then exit 1; fi
echo "layering: every include points down"
