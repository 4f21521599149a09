#!/bin/bash
# SPDX-License-Identifier: Apache-2.0
# The fences of a systemd unit in numbers, for tests that put a daemon behind them: a line with its capabilities, one with the
# system calls that its filter lets pass, one with those that it refuses. The latter two are empty where no systemd-analyze says what
# the groups of calls hold.
# usage: unit-fences.sh UNIT COMPILER
set -euo pipefail
unit="$1"
declare -A number passes
while read -r _ name value _; do
    number["${name#__NR_}"]="$value"
done < <(printf '#include <sys/syscall.h>\n#include <linux/capability.h>\n' | "$2" -E -dM -x c - | grep -E '^#define (__NR_[a-z0-9_]+|CAP_[A-Z_]+) [0-9]+$')

# change SETTING NAME...: for a group, all that is in it.
change() {
    local setting="$1" name
    shift
    for name in "$@"; do
        if [[ "$name" == @* ]]; then
            # shellcheck disable=SC2046 # a word for each call
            change "$setting" $(systemd-analyze syscall-filter --no-pager "$name" | sed -E '1d;/#/d')
        elif [[ "$setting" == passes ]]; then
            passes["$name"]=1
        else
            unset "passes[$name]"
        fi
    done
}

for name in $(sed -n 's/^CapabilityBoundingSet=//p' "$unit"); do
    printf '%s ' "${number[$name]}"
done
echo
if [[ -n "$(type -p systemd-analyze)" ]]; then
    change passes @default
    while read -r line; do
        case "$line" in
        ~*) change fails ${line#\~} ;;
        *) change passes $line ;;
        esac
    done < <(sed -n 's/^SystemCallFilter=//p' "$unit")
    numbersOf() { for name in "$@"; do [[ -z "${number[$name]:-}" ]] || printf '%s ' "${number[$name]}"; done; echo; }
    numbersOf "${!passes[@]}"
    passed=("${!passes[@]}")
    change passes @known
    change fails "${passed[@]}"
    numbersOf "${!passes[@]}"
fi
