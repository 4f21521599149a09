#!/bin/bash
# SPDX-License-Identifier: Apache-2.0
# coverage.sh BUILD [--write [PATTERN]]: runs tests one by one with the formats they print recorded, and holds
# docs/coverage.md against that. Without --write only the tests that the page names are run; with it all of them, or those
# that match the pattern while the others' recordings are kept, and the page is written anew.
set -euo pipefail
build="$(realpath "$1")"
write="${2:-}"
pattern="${3:-}"
records="$build/coverage"
[[ -n "$pattern" ]] || rm -rf "$records"
mkdir -p "$records"

# recordOne PROGRAM SUITE.NAME: a test that fails is somebody else's to find; here only what it printed counts.
recordOne() {
    local all
    all="$(mktemp)"
    ZORVANE_MESSAGES="$all" LD_PRELOAD="$build/lib/libzor_message_recorder.so" \
        timeout 300 "$1" --gtest_filter="$2:*/$2/*:$2/*" </dev/null >/dev/null 2>&1 || echo "$2 failed"
    sort -u "$all" >"$records/$2"
    rm -f "$all"
}
export -f recordOne
export build records

# The tests of a program as Suite.Name, each once whatever its parameters.
testsOf() {
    "$1" --gtest_list_tests | awk '/^[^ ]/ { suite = $1; sub(".*/", "", suite) } /^  / { sub("/.*", "", $1); print suite $1 }' | sort -u
}

for program in "$build"/bin/zor_*_tests; do
    [[ "$program" != */zor_house_tests ]] || continue
    for name in $(testsOf "$program"); do
        if [[ -n "$write" ]]; then
            [[ "$name" =~ $pattern ]] || continue
        else
            grep -q "| $name |\$" docs/coverage.md || continue
        fi
        printf '%s\0%s\0' "$program" "$name"
    done
done | xargs -0 -r -n 2 -P "${ZORVANE_JOBS:-$(nproc)}" bash -c 'recordOne "$@"' -

export ZORVANE_RECORDINGS="$records"
if [[ -n "$write" ]]; then
    ZORVANE_COVERAGE_WRITE=1 "$build/bin/zor_house_tests" --gtest_brief=1 --gtest_filter='CoveragePage.IsWritten'
fi
"$build/bin/zor_house_tests" --gtest_brief=1 --gtest_filter='CoveragePage.*'
