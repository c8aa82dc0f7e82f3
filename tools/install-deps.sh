#!/usr/bin/env bash
# Installs the Debian packages the build, the emulated phone and the tests need.
# Idempotent: does nothing when everything is there.
#
#   tools/install-deps.sh          the native (host) build
#   tools/install-deps.sh --arm    also the 32-bit ARM build and running it under qemu
set -eu
arm=0
case "${1:-}" in
    "") ;;
    --arm) arm=1 ;;
    *) echo "usage: $0 [--arm]" >&2; exit 2 ;;
esac

sudo=""
[ "$(id -u)" -eq 0 ] || sudo="sudo"

pkgs=(build-essential cmake ninja-build pkg-config bubblewrap util-linux procps
      libgtest-dev libgmock-dev android-liblog-dev android-libcutils-dev libfuse3-dev fuse3
      chromium tzdata less)
if [ $arm = 1 ]; then
    # Not crossbuild-essential-armhf: it would upgrade the host's perl.
    pkgs+=(g++-arm-linux-gnueabihf qemu-user-static
           android-liblog-dev:armhf android-libcutils-dev:armhf libgtest-dev:armhf libgmock-dev:armhf
           libfuse3-dev:armhf libasan8:armhf libubsan1:armhf)
fi

missing=()
for p in "${pkgs[@]}"; do
    dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
if [ ${#missing[@]} -gt 0 ]; then
    if [ $arm = 1 ] && ! dpkg --print-foreign-architectures | grep -qx armhf; then
        $sudo dpkg --add-architecture armhf
    fi
    echo "installing: ${missing[*]}"
    $sudo apt-get update -qq
    DEBIAN_FRONTEND=noninteractive $sudo apt-get install -y -qq --no-install-recommends "${missing[@]}"
fi
[ $arm = 1 ] || exit 0

# The phone, tavlologctl started by the tests and gtest's test discovery all
# start further armhf programs, so the kernel itself must hand them to qemu.
# The registration does not survive a reboot: check it every time.
binfmt=/proc/sys/fs/binfmt_misc
refused() {
    echo "install-deps: $*" >&2
    echo "install-deps: armhf programs cannot run on this machine; the --arm build and tests need" >&2
    echo "install-deps: binfmt_misc (e.g. a container started with --privileged, or a VM)." >&2
    exit 1
}
if [ ! -e "$binfmt/register" ]; then
    $sudo mount -t binfmt_misc binfmt_misc "$binfmt" 2>/dev/null ||
        refused "the kernel refused to mount binfmt_misc on $binfmt"
fi
if [ ! -e "$binfmt/qemu-arm" ]; then
    conf=/usr/lib/binfmt.d/qemu-arm.conf
    [ -r "$conf" ] || refused "no $conf (from qemu-user-static)"
    # One line ":name:type:offset:magic:mask:interpreter:flags".
    grep -v '^#' "$conf" | $sudo tee "$binfmt/register" >/dev/null 2>&1 ||
        refused "the kernel refused the qemu-arm registration from $conf"
fi
grep -qx enabled "$binfmt/qemu-arm" 2>/dev/null || refused "qemu-arm is registered but not enabled"
