#!/usr/bin/env bash
# Installs the Debian packages the build, the emulated phone and the tests need.
# Idempotent: does nothing when everything is there.
set -eu
pkgs=(build-essential cmake ninja-build pkg-config bubblewrap util-linux procps
      libgtest-dev libgmock-dev android-liblog-dev android-libcutils-dev libfuse3-dev fuse3)
missing=()
for p in "${pkgs[@]}"; do
    dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
[ ${#missing[@]} -eq 0 ] && exit 0
sudo=""
[ "$(id -u)" -eq 0 ] || sudo="sudo"
echo "installing: ${missing[*]}"
$sudo apt-get update -qq
DEBIAN_FRONTEND=noninteractive $sudo apt-get install -y -qq "${missing[@]}"
