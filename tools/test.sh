#!/usr/bin/env bash
# Builds everything and runs every test. With --sanitize, the same tests built
# with AddressSanitizer and UndefinedBehaviorSanitizer, in build-asan/.
set -eu
cd "$(dirname "$0")/.."
tools/install-deps.sh
build=build
extra=()
if [ "${1:-}" = "--sanitize" ]; then
    build=build-asan
    extra=(-DTAVLO_SANITIZE=ON)
    export ASAN_OPTIONS=detect_leaks=1:abort_on_error=1
    export UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1
fi
cmake -S . -B "$build" -G Ninja "${extra[@]}" >/dev/null
cmake --build "$build"
ctest --test-dir "$build" --output-on-failure -j"$(nproc)"
