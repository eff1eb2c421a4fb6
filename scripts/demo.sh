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

# An application with a signing identity: a copy of typhoractl that the platform's manifest
# names, with the user-fonts entitlement; and the view service the daemon's dialogs start.
ctl_bin="$top/build/debug/tools/typhoractl"
mkdir -p "$demo_dir/apps" "$demo_dir/root/etc/typhora/apps" "$demo_dir/root/etc/typhora/view-services"
cp "$ctl_bin" "$demo_dir/apps/fontshop"
cat >"$demo_dir/root/etc/typhora/apps/fontshop.plist" <<JSON
{"identifier": "com.example.fontshop", "executable": "$demo_dir/apps/fontshop",
 "sha256": "$(sha256sum "$demo_dir/apps/fontshop" | cut -d' ' -f1)",
 "shortVersionString": "1.0",
 "entitlements": {"com.zorvane.developer.user-fonts": ["app-usage", "system-installation"]}}
JSON
cat >"$demo_dir/root/etc/typhora/view-services/com.zorvane.FontInstallViewService.plist" <<JSON
{"Program": "$ctl_bin", "Arguments": ["view-service", "--print"]}
JSON

ctl="$top/build/debug/tools/typhoractl --runtime-dir $demo_dir/run"
cat <<MSG
typhora demo
  device root:  $demo_dir/root
  service:      $demo_dir/run/com.zorvane.typhorad

From another terminal, talk to it:
  $ctl updating-user-fonts
  $ctl call 'updatingUserFonts:'
  $ctl plist show $demo_dir/root/var/mobile/Library/UserFonts/UserFonts.plist
  $ctl event watch                       # every notification posted
  $ctl event post --system com.example.ping
  $demo_dir/apps/fontshop --runtime-dir $demo_dir/run call 'checkin:'
                                         # a signed font provider checks in: its fonts and a
                                         # token for its directory
  $ctl call 'checkin:'                   # an unsigned program has no capability: [null]

Starting typhorad in the foreground (Ctrl-C to stop)...
MSG
exec "$top/build/debug/src/typhorad" --root "$demo_dir/root" --runtime-dir "$demo_dir/run" \
  --log-level debug
