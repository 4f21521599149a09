# SPDX-License-Identifier: Apache-2.0
# bash completion for zorvanectl, which knows its commands itself.
_zorvanectl() {
    local IFS=$'\n'
    COMPREPLY=($(zorvanectl __complete "${COMP_WORDS[@]:1:COMP_CWORD}" 2>/dev/null | cut -f 1))
}
complete -o default -F _zorvanectl zorvanectl
