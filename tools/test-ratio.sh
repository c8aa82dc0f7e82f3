#!/usr/bin/env bash
# Prints the lines of the tests (tests/ and fuzz/) against the lines of the
# rest of the source tree, and their ratio. Counted: every line of the tracked
# C++ sources and headers, CMake files and shell scripts (a file starting with
# "#!"); prose (README and other .md files) and data files are not counted.
set -eu
cd "$(dirname "$0")/.."

is_source() {
    case $1 in
        *.cpp | *.h | *.cmake | */CMakeLists.txt | CMakeLists.txt) return 0 ;;
    esac
    [ "$(head -c 2 "$1")" = "#!" ]
}

tests=0
code=0
while IFS= read -r f; do
    [ -f "$f" ] && is_source "$f" || continue
    n=$(wc -l < "$f")
    case $f in
        tests/* | fuzz/*) tests=$((tests + n)) ;;
        *) code=$((code + n)) ;;
    esac
done < <(git ls-files)

echo "tests: $tests lines (tests/, fuzz/)"
echo "code:  $code lines (everything else)"
awk -v t="$tests" -v c="$code" 'BEGIN { printf "ratio: %.1f%%\n", c ? 100 * t / c : 0 }'
