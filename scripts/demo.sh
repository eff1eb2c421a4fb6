#!/usr/bin/env bash
# The demo: installs what is missing, builds, lays out a device root with a few installed fonts,
# and runs typhorad on it in the foreground with readable logs. Ctrl-C stops it.
set -euo pipefail
cd "$(dirname "$0")/.."
top=$(pwd)

scripts/deps.sh
cmake --preset debug >/dev/null
cmake --build --preset debug -j "$(nproc)" --target typhorad typhoractl

demo_dir="${TYPHORA_DEMO_DIR:-/tmp/typhora-demo}"
rm -rf "$demo_dir"
mkdir -p "$demo_dir/run"
cp -a demo/root "$demo_dir/root"

ctl="$top/build/debug/tools/typhoractl --runtime-dir $demo_dir/run"
cat <<MSG
typhora demo
  device root:  $demo_dir/root
  service:      $demo_dir/run/com.zorvane.typhorad

From another terminal, talk to it:
  $ctl updating-user-fonts
  $ctl call 'updatingUserFonts:'
  $ctl plist show $demo_dir/root/var/mobile/Library/UserFonts/UserFonts.plist

Starting typhorad in the foreground (Ctrl-C to stop)...
MSG
exec "$top/build/debug/src/typhorad" --root "$demo_dir/root" --runtime-dir "$demo_dir/run" \
  --log-level debug
