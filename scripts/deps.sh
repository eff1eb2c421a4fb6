#!/usr/bin/env bash
# Installs the Debian packages typhora builds and tests with, only those that are missing.
set -euo pipefail

packages=(
  g++ clang libclang-rt-14-dev cmake ninja-build pkg-config git
  libcbor-dev libsodium-dev nettle-dev libsimdjson-dev libsystemd-dev libfreetype-dev
  libgtest-dev libgmock-dev libbenchmark-dev
  systemd procps fontconfig libfontconfig-dev dbus-daemon scdoc
  fonts-dejavu-core fonts-noto-core fonts-wqy-microhei fonts-inter-variable
)

missing=()
for p in "${packages[@]}"; do
  if ! dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed"; then
    missing+=("$p")
  fi
done
if [ "${#missing[@]}" -eq 0 ]; then
  exit 0
fi

echo "typhora: installing ${missing[*]}" >&2
sudo_cmd=()
if [ "$(id -u)" -ne 0 ]; then
  sudo_cmd=(sudo)
fi
export DEBIAN_FRONTEND=noninteractive
"${sudo_cmd[@]}" apt-get update -qq
"${sudo_cmd[@]}" apt-get install -y -qq --no-install-recommends "${missing[@]}"
