#!/bin/bash
# SPDX-License-Identifier: Apache-2.0
# Builds the packages as a distribution's builder does: in a bare Debian 12 with the packages of Build-Depends and nothing else,
# from the files that git has, by a user without power or network. lintian has to find nothing, and the packages have to be
# those in PACKAGES: by name, control file, and each file's name, owner and mode.
# usage: tools/package-bare.sh PACKAGES WORK-FOLDER BARE-SYSTEM
set -euo pipefail
packages="$(readlink -f "${1:?folder of the packages}")"
work="$(readlink -m "${2:?work folder}")"
base="$(readlink -m "${3:?folder of the bare system}")"
cd "$(dirname "$(readlink -f "${BASH_SOURCE[0]}")")/.."
# shellcheck source=tools/bare-system.sh
source tools/bare-system.sh
inOwnNamespaces tools/package-bare.sh "$packages" "$work" "$base"
root="$work/root"
log="$work/log"

fail() {
    echo "package-bare: $*" >&2
    exit 1
}
inside() { asInstalled "${@:1:$#-1}" chroot "$root" -- "${!#}" >>"$log" 2>&1; }

bareSystem "$base" "$root" || fail "there is no bare system"
: >"$log"
mount -t proc proc "$root/proc"
mkdir -p "$root/build/zorvane"
git ls-files -z | tar --null --files-from=- --create | tar -x -C "$root/build/zorvane"

say "What Build-Depends names"
inside 'apt-get -q update && cd /build/zorvane && apt-get -y -q --no-install-recommends build-dep ./' || fail "not installed: $log"
inside 'useradd --home-dir /build builder && chown -R builder /build'

say "The packages, without power or network"
inside unshare --net "cd /build/zorvane && DEB_BUILD_OPTIONS=parallel=${ZORVANE_JOBS:-$(nproc)} setpriv --reuid=builder --regid=builder --clear-groups \
    env HOME=/nonexistent dpkg-buildpackage -us -uc -b" || { tail -n 30 "$log"; fail "not built: $log"; }
lintian --fail-on error,warning --allow-root "$root"/build/*.changes

# described FOLDER: all that makes the packages what they are but for the bytes of the files.
described() {
    local package
    for package in "$1"/*.deb; do
        [[ "$package" != *-dbgsym_* ]] || continue
        echo "== ${package##*/}"
        dpkg-deb -f "$package" | sed '/^Installed-Size:/d'
        dpkg-deb -c "$package" | awk '{ print $1, $2, $6, $7, $8 }'
    done
}
diff <(described "$packages") <(described "$root/build") || fail "the packages are others than those in $packages"
echo "package-bare: all as it should be"
