# SPDX-License-Identifier: Apache-2.0
# fish completion for zorvanectl, which knows its commands itself.
function __zorvanectl_candidates
    set -l words (commandline -opc)
    set -l found (zorvanectl __complete $words[2..] (commandline -ct) 2>/dev/null)
    if set -q found[1]
        printf '%s\n' $found
    else
        __fish_complete_path (commandline -ct)
    end
end
complete -c zorvanectl -f -a '(__zorvanectl_candidates)'
