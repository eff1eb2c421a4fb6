#!/usr/bin/env bash
# The demo: installs what is missing, builds, lays out a device root with real fonts installed by
# three font providers and a few signed applications, and runs typhorad on it in the foreground
# with readable logs. Ctrl-C stops it.
set -euo pipefail
cd "$(dirname "$0")/.."
top=$(pwd)

scripts/deps.sh
cmake --preset debug >/dev/null
cmake --build --preset debug -j "$(nproc)" --target typhorad typhoractl

demo_dir="${TYPHORA_DEMO_DIR:-/tmp/typhora-demo}"
root="$demo_dir/root"
run="$demo_dir/run"
apps="$demo_dir/apps"
rm -rf "$demo_dir"
mkdir -p "$run" "$apps" "$root/etc/typhora/apps" "$root/etc/typhora/view-services"
cp -a demo/root/. "$root"
ctl_bin="$top/build/debug/tools/typhoractl"

# Fonts from Debian's fonts-dejavu-core, installed by three providers. "DejaVu Sans" is enabled;
# "DejaVu Serif" is disabled, and two providers have it.
user_fonts="$root/var/mobile/Library/UserFonts"
dejavu=/usr/share/fonts/truetype/dejavu
records=()
install_font() {  # provider, file, disabled
  mkdir -p "$user_fonts/FontFiles/$1"
  cp "$dejavu/$2" "$user_fonts/FontFiles/$1/"
  local names
  names=$("$ctl_bin" font-names "$user_fonts/FontFiles/$1/$2")
  records+=("\"/var/mobile/Library/UserFonts/FontFiles/$1/$2\": {\"familyName\": $names, \"disabled\": $3}")
}
install_font com.example.fontshop DejaVuSans.ttf false
install_font com.example.fontshop DejaVuSans-Bold.ttf false
install_font com.example.letterpress DejaVuSerif.ttf true
install_font com.example.typecase DejaVuSerif-Bold.ttf true
(IFS=,; echo "{${records[*]}}") >"$user_fonts/UserFonts.plist"

# Applications: copies of typhoractl that the platform's manifests sign. `sandbox` makes them
# read only what the daemon's tokens open.
install_app() {  # name, identifier, entitlements (JSON), sandboxed (true/false)
  cp "$ctl_bin" "$apps/$1"
  local sandbox=""
  if [ "$4" = true ]; then sandbox=', "sandbox": {"readOnlyPaths": []}'; fi
  cat >"$root/etc/typhora/apps/$1.plist" <<JSON
{"identifier": "$2", "executable": "$apps/$1", "shortVersionString": "1.0",
 "sha256": "$(sha256sum "$apps/$1" | cut -d' ' -f1)", "entitlements": $3$sandbox}
JSON
}
install_app fontshop com.example.fontshop \
  '{"com.zorvane.developer.user-fonts": ["app-usage", "system-installation"]}' false
install_app reader com.example.reader '{"com.zorvane.developer.user-fonts": ["app-usage"]}' true
install_app browser com.example.browser \
  '{"com.zorvane.developer.user-fonts": ["font-enumeration"]}' true
install_app webcontent com.example.browser.WebContent '{}' true
install_app notes com.example.notes '{}' true
install_app picker com.zorvane.Panelor.FontPicker '{}' false

# The view service the missing-fonts dialog starts: it shows what it was given and picks the
# typecase's "DejaVu Serif", as a user would.
cat >"$root/etc/typhora/view-services/com.zorvane.FontInstallViewService.plist" <<JSON
{"Program": "$ctl_bin",
 "Arguments": ["view-service", "--print", "--choose", "DejaVu Serif=com.example.typecase"]}
JSON
# Puts the program it runs in the foreground (a dialog is shown only then), keeping its pid.
cat >"$demo_dir/foreground" <<SH
#!/bin/sh
"$ctl_bin" --root "$root" app-state set \$\$ 8 >/dev/null && exec "\$@"
SH
chmod +x "$demo_dir/foreground"

ctl="$ctl_bin --runtime-dir $run"
cat <<MSG
typhora demo
  device root:  $root
  service:      $run/com.zorvane.typhorad
  applications: $apps (reader, browser with its web-content process, notes, picker, fontshop)

From another terminal, paste these:

  # 0. typhoractl on the path, pointed at this demo's device root and sockets.
  export PATH="$top/build/debug/tools:\$PATH" TYPHORA_ROOT=$root TYPHORA_RUNTIME_DIR=$run

  # A browser that checked in and prints every font change it is told of (leave it running).
  $apps/browser client --watch &
  # Install fonts by file as a font provider would: the browser prints the change.
  typhoractl font install --provider com.example.fonts /usr/share/fonts/truetype/dejavu/*.ttf
  typhoractl font list --provider com.example.fonts
  # The reader asks for a family that just arrived; the ledger then shows what it was given.
  $apps/reader request-fonts --family "DejaVu Sans Mono" >/dev/null
  typhoractl grants --table
  typhoractl status --table            # or plain JSON, or --metrics for a scraper

  # 1. An installed, enabled family: answered at once (the fonts, with a token for each file).
  $apps/reader --runtime-dir $run request-fonts --family "DejaVu Sans"

  # 2. A disabled family that two providers have: the dialog's view service (in this terminal)
  #    picks com.example.typecase; only its file comes back, and it is now enabled on disk.
  $demo_dir/foreground $apps/reader --runtime-dir $run request-fonts --family "DejaVu Serif"
  $ctl plist show $user_fonts/UserFonts.plist
  $apps/reader --runtime-dir $run call 'checkin:'   # the reader keeps what it was given

  # 3. A browser's web-content process receives the browser's fonts with tokens of its own.
  $apps/browser --runtime-dir $run web-content-app --child $apps/webcontent

  # 4. The font picker delivers the family of DejaVuSans-Bold to the notes application.
  $apps/notes --runtime-dir $run picker-client --picker $apps/picker --name DejaVuSans-Bold

  # More: the platform's side.
  $ctl event watch                       # every notification posted
  $apps/fontshop --runtime-dir $run call 'checkin:'   # a font provider: its own fonts
  $ctl call 'checkin:'                   # an unsigned program has no capability: [null]

Starting typhorad in the foreground (Ctrl-C to stop)...
MSG
exec "$top/build/debug/src/typhorad" --root "$root" --runtime-dir "$run" --log-level debug
