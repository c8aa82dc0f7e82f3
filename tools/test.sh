#!/usr/bin/env bash
# Builds everything and runs every test.
#
#   tools/test.sh [--arm] [--sanitize]
#
# --sanitize: the same tests built with AddressSanitizer and
# UndefinedBehaviorSanitizer. --arm: built for the phone's 32-bit ARM
# processor and run under qemu (daemon, phone, tools and tests alike).
# Each combination has its own folder: build, build-asan, build-armhf,
# build-armhf-asan. The native suite runs every test; the others run every
# test but the one that waits five minutes for the boot-copy timer: its
# code runs in many faster cases too, and its wait would take most of CI.
set -eu
cd "$(dirname "$0")/.."
arm=0
sanitize=0
for arg in "$@"; do
    case $arg in
        --arm) arm=1 ;;
        --sanitize) sanitize=1 ;;
        *) echo "usage: $0 [--arm] [--sanitize]" >&2; exit 2 ;;
    esac
done

build=build
extra=()
if [ $arm = 1 ]; then
    tools/install-deps.sh --arm
    build=build-armhf
    extra+=(-DCMAKE_TOOLCHAIN_FILE="$PWD/cmake/armhf-toolchain.cmake")
else
    tools/install-deps.sh
fi
if [ $sanitize = 1 ]; then
    build=$build-asan
    extra+=(-DTAVLO_SANITIZE=ON)
    # LeakSanitizer needs ptrace, which qemu does not offer.
    leaks=1
    [ $arm = 0 ] || leaks=0
    export ASAN_OPTIONS=detect_leaks=$leaks:abort_on_error=1
    export UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1
fi
skip=()
[ $arm = 0 ] && [ $sanitize = 0 ] || skip=(-E '/Boot\.Runs/NoClientForFiveMinutesCopiesTheBootLogs( |$)')
jobs=$(nproc)
cmake -S . -B "$build" -G Ninja "${extra[@]}" >/dev/null
cmake --build "$build" -j"$jobs"
ctest --test-dir "$build" --output-on-failure -j"$jobs" "${skip[@]}"
