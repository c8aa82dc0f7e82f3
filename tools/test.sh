#!/usr/bin/env bash
# Builds everything and runs every test.
#
#   tools/test.sh [--arm] [--sanitize] [--skip-wait|--only-wait] [--build-only]
#
# --build-only builds and runs nothing (CI builds the next suite while one runs).
# --sanitize: the same tests built with AddressSanitizer and
# UndefinedBehaviorSanitizer. --arm: built for the phone's 32-bit ARM
# processor and run under qemu (daemon, phone, tools and tests alike).
# Each combination has its own folder: build, build-asan, build-armhf,
# build-armhf-asan.
#
# One test only waits five minutes for the daemon's boot-copy timer. The
# native suite runs it, the others skip it (the stop and the copy after the
# wait run in their other cases). --skip-wait leaves it out of the native
# suite too, --only-wait runs nothing else: CI runs it beside the other suites.
# The tests that load the HTML report in the host's headless Chromium run in
# the native suite only: the browser is the same host program in every suite,
# and its loads would cost each of them most of a minute.
set -eu
cd "$(dirname "$0")/.."
readonly wait_test='/Boot\.Runs/NoClientForFiveMinutesCopiesTheBootLogs( |$)'
usage() { echo "usage: $0 [--arm] [--sanitize] [--skip-wait|--only-wait] [--build-only]" >&2; exit 2; }
arm=0
sanitize=0
wait=run
build_only=0
for arg in "$@"; do
    case $arg in
        --arm) arm=1 ;;
        --sanitize) sanitize=1 ;;
        --skip-wait) wait=skip ;;
        --only-wait) wait=only ;;
        --build-only) build_only=1 ;;
        *) usage ;;
    esac
done
if [ $arm = 1 ] || [ $sanitize = 1 ]; then
    [ $wait != only ] || usage
    wait=skip
fi
select=()
[ $wait != skip ] || select=(-E "$wait_test")
[ $wait != only ] || select=(-R "$wait_test")

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
browser=ON
[ $arm = 0 ] && [ $sanitize = 0 ] || browser=OFF
extra+=(-DTAVLO_BROWSER_TESTS=$browser -DTAVLO_BENCHMARKS=$browser)
jobs=$(nproc)
tools/check-layers.sh
cmake -S . -B "$build" -G Ninja "${extra[@]}" >/dev/null
cmake --build "$build" -j"$jobs"
[ $build_only = 0 ] || exit 0
# The tests mostly wait (phones booting, the daemon's one-second writer, its
# timers), so twice as many as there are processors run at once.
ctest --test-dir "$build" --output-on-failure -j$((2 * jobs)) "${select[@]}"
