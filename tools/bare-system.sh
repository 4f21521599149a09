# SPDX-License-Identifier: Apache-2.0
# For the tools that try something in a bare Debian 12: they source this. Their mounts and processes end with them.

# inOwnNamespaces SCRIPT [ARGUMENTS]: the script again, in namespaces of its own.
inOwnNamespaces() {
    [[ -z "${ZORVANE_OWN_NAMESPACES:-}" ]] || return 0
    # All that is started ends with the first process of the namespace; its mounts go with it.
    ZORVANE_OWN_NAMESPACES=1 exec unshare --mount --pid --fork --kill-child --mount-proc --propagation private "$@"
}

say() { printf '\n== %s\n' "$*"; }

# bareSystem BASE ROOT: a fresh copy of the bare system in ROOT, which finds packages as this system does. BASE keeps it for others.
bareSystem() {
    local base="$1" root="$2" mirror
    if [[ ! -e "$base/usr" ]]; then
        say "A bare Debian 12"
        mirror="$(grep -rhoE 'https?://[^ ]*/debian/?( |$)' /etc/apt/sources.list /etc/apt/sources.list.d 2>/dev/null | head -n 1)" || true
        rm -rf "$base.new"
        mkdir -p "$(dirname "$base")"
        debootstrap --variant=minbase --include=systemd-sysv,dbus bookworm "$base.new" ${mirror:+"$mirror"} >"$base.log" 2>&1 || {
            echo "no bare system could be made: $base.log" >&2
            return 1
        }
        chroot "$base.new" apt-get clean
        mv "$base.new" "$base"
    fi
    rm -rf "$root"
    mkdir -p "$(dirname "$root")"
    cp -a "$base" "$root"
    rm -f "$root/etc/resolv.conf"
    cp -L /etc/resolv.conf "$root/etc/resolv.conf"
}

# asInstalled ENTER... -- COMMAND: a shell's command behind what enters the system, with nothing of this one's surroundings.
asInstalled() {
    local enter=()
    while [[ "$1" != -- ]]; do
        enter+=("$1")
        shift
    done
    "${enter[@]}" /usr/bin/env -i PATH=/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin HOME=/root \
        DEBIAN_FRONTEND=noninteractive LC_ALL=C.UTF-8 bash -c "$2"
}
