#!/usr/bin/env bash
# Builds the Debian package from a Release build (build/package), then checks it without
# installing it on this machine: its file list, its contents unpacked into a throw-away root, its
# maintainer scripts, and its systemd units with systemd-analyze verify.
# Prints the package's path last.
set -euo pipefail
cd "$(dirname "$0")/.."
top=$(pwd)
build="$top/build/package"

scripts/deps.sh
export CMAKE_C_COMPILER_LAUNCHER="${CMAKE_C_COMPILER_LAUNCHER:-ccache}"
export CMAKE_CXX_COMPILER_LAUNCHER="${CMAKE_CXX_COMPILER_LAUNCHER:-ccache}"
command -v ccache >/dev/null || unset CMAKE_C_COMPILER_LAUNCHER CMAKE_CXX_COMPILER_LAUNCHER
cmake -S . -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=Release -DCMAKE_INSTALL_PREFIX=/usr \
  -DTYPHORA_DEFAULT_ROOT=/var/lib/typhora -DTYPHORA_TESTS=OFF -DTYPHORA_BENCH=OFF \
  -DTYPHORA_WERROR=OFF >/dev/null
cmake --build "$build" -j "$(nproc)"
(cd "$build" && rm -f typhora_*.deb && cpack -G DEB >/dev/null)
deb=$(ls "$build"/typhora_*.deb)

fail() { echo "package.sh: $*" >&2; exit 1; }
listing=$(dpkg-deb -c "$deb")
for path in ./usr/bin/typhorad ./usr/bin/typhoractl \
  ./usr/lib/systemd/system/typhorad.service ./usr/lib/systemd/system/typhorad.socket \
  ./usr/lib/systemd/system/typhorad-events.socket ./usr/lib/systemd/system/typhorad-sandbox.socket \
  ./usr/lib/sysusers.d/typhora.conf \
  ./usr/lib/tmpfiles.d/typhora.conf ./usr/share/typhora/etc/typhora/typhorad.launch.plist \
  ./usr/share/man/man8/typhorad.8 ./usr/share/man/man1/typhoractl.1 \
  ./usr/share/bash-completion/completions/typhoractl; do
  grep -q " $path\$" <<<"$listing" || fail "$path is not in the package"
done
dpkg-deb -f "$deb" Depends | grep -q systemd || fail "the package does not depend on systemd"
dpkg-deb -I "$deb" postinst >/dev/null || fail "no postinst"

# Unpacked into a throw-away root: the programs run from there and the units verify against it.
unpacked=$(mktemp -d)
trap 'rm -rf "$unpacked"' EXIT
dpkg -x "$deb" "$unpacked"
"$unpacked/usr/bin/typhorad" --version | grep -q "^typhorad " || fail "typhorad --version"
"$unpacked/usr/bin/typhoractl" --version | grep -q "^typhoractl " || fail "typhoractl --version"
"$unpacked/usr/bin/typhoractl" --help | grep -q "/var/lib/typhora" ||
  fail "typhoractl does not default to the installed device root"
bash -n "$unpacked/usr/share/bash-completion/completions/typhoractl"
# The service's ExecStart names /usr/bin/typhorad: verify with the unpacked programs first on the
# path systemd-analyze searches.
units="$unpacked/usr/lib/systemd/system"
sed -i "s|/usr/bin/typhorad|$unpacked/usr/bin/typhorad|" "$units/typhorad.service"
(cd "$units" && SYSTEMD_LOG_LEVEL=notice systemd-analyze verify --man=no \
  typhorad.socket typhorad-events.socket typhorad-sandbox.socket typhorad.service) || fail "systemd-analyze verify failed"
echo "package.sh: $(dpkg-deb -f "$deb" Package) $(dpkg-deb -f "$deb" Version) checked"
echo "$deb"
