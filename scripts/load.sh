#!/usr/bin/env bash
# Runs `typhoractl load --clients` against a Release typhorad serving a device root of N user
# fonts, with typhoractl installed as an enumerating application, and prints the load's report.
#   scripts/load.sh [CLIENTS] [SECONDS] [FONTS]      (defaults: 50 60 1000)
set -euo pipefail

clients=${1:-50}
seconds=${2:-60}
fonts=${3:-1000}
repo=$(cd "$(dirname "$0")/.." && pwd)
cd "$repo"
scripts/deps.sh
cmake --preset release >/dev/null
cmake --build --preset release --target typhorad typhoractl >/dev/null

dir=$(mktemp -d /tmp/typhora-load-XXXXXX)
daemon_pid=
cleanup() {
  if [ -n "$daemon_pid" ]; then kill "$daemon_pid" 2>/dev/null || true; wait "$daemon_pid" 2>/dev/null || true; fi
  rm -rf "$dir"
}
trap cleanup EXIT

root=$dir/root
mkdir -p "$root/var/mobile/Library/UserFonts" "$root/etc/typhora/apps" "$dir/run" "$dir/bin"
echo '{}' > "$root/etc/typhora/typhorad.launch.plist"
{
  echo '{'
  for ((i = 0; i < fonts; i++)); do
    [ "$i" -gt 0 ] && echo ','
    disabled=false
    [ $((i % 7)) -eq 0 ] && disabled=true
    printf '"/var/mobile/Library/UserFonts/FontFiles/com.example.provider%d/Family%d.otf": ' $((i % 50)) "$i"
    printf '{"familyName": {"Family%d-Regular": "Family %d", "Family%d-Bold": "Family %d"}, ' "$i" "$i" "$i" "$i"
    printf '"disabled": %s, "fileSize": %d}' "$disabled" $((100000 + i))
  done
  echo '}'
} > "$root/var/mobile/Library/UserFonts/UserFonts.plist"

ctl=$dir/bin/typhoractl
cp build/release/tools/typhoractl "$ctl"
digest=$(sha256sum "$ctl" | cut -c1-64)
cat > "$root/etc/typhora/apps/load.plist" <<PLIST
{"identifier": "com.example.load", "executable": "$ctl", "sha256": "$digest",
 "entitlements": {"com.zorvane.developer.user-fonts": ["font-enumeration"]},
 "sandbox": {"readOnlyPaths": []}}
PLIST

build/release/src/typhorad --root "$root" --runtime-dir "$dir/run" --log-level error \
  --log-target stderr 2>"$dir/daemon.log" &
daemon_pid=$!
for _ in $(seq 1 400); do [ -S "$dir/run/com.zorvane.typhorad" ] && break; sleep 0.05; done

echo "load average before: $(cut -d' ' -f1-3 /proc/loadavg)" >&2
status=0
"$ctl" --runtime-dir "$dir/run" load --clients "$clients" --seconds "$seconds" \
  --family "Family 1" \
  --changed-url "file:///var/mobile/Library/UserFonts/FontFiles/com.example.provider1/Family1.otf" ||
  status=$?
echo "load average after: $(cut -d' ' -f1-3 /proc/loadavg)" >&2
if [ -s "$dir/daemon.log" ]; then echo "daemon log:" >&2; tail -20 "$dir/daemon.log" >&2; fi
exit $status
