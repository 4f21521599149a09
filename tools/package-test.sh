#!/bin/bash
# SPDX-License-Identifier: Apache-2.0
# Tries the packages in a bare Debian 12 of its own: installed by the lines of the README, upgraded, downgraded, removed and
# purged, with what users keep compared at each step. In namespaces, so it needs root but no systemd; systemctl is a stand-in
# there that runs what the unit runs. Ends with the first surprise.
# usage: tools/package-test.sh PACKAGES WORK-FOLDER
set -euo pipefail
packages="$(readlink -f "${1:?folder of the packages}")"
work="$(readlink -m "${2:?work folder}")"
cd "$(dirname "$(readlink -f "${BASH_SOURCE[0]}")")/.."
base="$work/base"
root="$work/root"

fail() {
    echo "package-test: $*" >&2
    [[ ! -e "$root/zorvaned.console" ]] || tail -n 20 "$root/zorvaned.console" >&2
    exit 1
}
say() { printf '\n== %s\n' "$*"; }

if [[ -z "${ZORVANE_PACKAGE_TEST:-}" ]]; then
    # All that is started ends with the first process of the namespace; its mounts go with it.
    ZORVANE_PACKAGE_TEST=1 exec unshare --mount --pid --ipc --uts --fork --kill-child --propagation private \
        "$(readlink -f "${BASH_SOURCE[0]}" 2>/dev/null || echo tools/package-test.sh)" "$packages" "$work"
fi

if [[ ! -e "$base/usr" ]]; then
    say "A bare Debian 12"
    mirror="$(grep -rhoE 'https?://[^ ]*/debian/?( |$)' /etc/apt/sources.list /etc/apt/sources.list.d 2>/dev/null | head -n 1)"
    debootstrap --variant=minbase bookworm "$work/base.new" "${mirror:-http://deb.debian.org/debian}" >"$work/debootstrap.log" 2>&1 ||
        fail "no bare system: $work/debootstrap.log"
    chroot "$work/base.new" apt-get clean
    mv "$work/base.new" "$base"
fi

rm -rf "$root"
cp -a "$base" "$root"
mount --bind "$root" "$root" # sandboxes need a mount point
mount -t proc proc "$root/proc"
mount -t tmpfs -o mode=0755 tmpfs "$root/run"
mount -t tmpfs tmpfs "$root/dev/shm"
for device in null zero full random urandom tty; do
    [[ -e "$root/dev/$device" ]] || cp -a "/dev/$device" "$root/dev/"
done
mkdir -p "$root/build/packages"
cp "$packages"/*.deb "$root/build/packages/"
rm -f "$root"/build/packages/*-dbgsym_*.deb
cp -L /etc/resolv.conf "$root/etc/resolv.conf" 2>/dev/null || true
printf '#!/bin/sh\nexit 101\n' >"$root/usr/sbin/policy-rc.d" # maintainer scripts start nothing here
chmod 755 "$root/usr/sbin/policy-rc.d"

inside() { chroot "$root" /usr/bin/env -i PATH=/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin HOME=/root \
    DEBIAN_FRONTEND=noninteractive LC_ALL=C.UTF-8 bash -c "$1"; }

cat >"$root/usr/local/bin/systemctl" <<'TEXT'
#!/bin/bash
# start and stop, as the service manager would: with the unit's command.
command="$(sed -n 's/^ExecStart=//p' /lib/systemd/system/zorvaned.service)"
case "$1" in
start)
    setsid $command </dev/null >>/zorvaned.console 2>&1 &
    echo $! >/run/zorvaned.pid
    for ((try = 0; try < 200; ++try)); do
        [[ -S /run/zorvane/zorvaned.status ]] && exit 0
        kill -0 "$(cat /run/zorvaned.pid)" 2>/dev/null || exit 1
        sleep 0.1
    done
    exit 1
    ;;
stop)
    kill "$(cat /run/zorvaned.pid)"
    for ((try = 0; try < 200; ++try)); do
        kill -0 "$(cat /run/zorvaned.pid)" 2>/dev/null || break
        sleep 0.1
    done
    rm -f /run/zorvane/zorvaned.status
    ;;
esac
TEXT
chmod 755 "$root/usr/local/bin/systemctl"

say "The lines of the README, as they stand"
lines="$(sed -n '/^<!-- .*runs these lines/,/^```$/p' README.md | sed '1,2d;$d')"
[[ "$lines" == *zorvane-run* ]] || fail "README.md has no lines to run"
inside "apt-get -q update >/dev/null; set -eux; cd /; $lines" || fail "a line of the README failed"
list="$(find "$root/home/ann/Containers" -name list)"
[[ "$(cat "$list")" == milk ]] || fail "the program's file is not in its container"
[[ "$(stat -c %U "$root/private/var/brevad")" != www-data ]] || fail "bundles belong to www-data"

# What users keep, by name, owner and content.
kept() { (cd "$root" && find home private/var/containers private/var/root/Library/Zorvane -type f ! -name '*.log' -printf '%p %U %m\n' \
    -exec sha256sum {} + | sort); }
inside 'zorvanectl entitlements set org.example.notes --app-group group.org.example && zorvanectl groups org.example.notes --user 1000 &&
    zorvanectl create org.example.notes --class bundle-app' || fail "no groups"
before="$(kept)"

# repacked VERSION: the same packages under another version.
repacked() {
    local package
    mkdir -p "$root/build/$1"
    for package in "$root"/build/packages/*.deb; do
        rm -rf "$work/repack"
        dpkg-deb -R "$package" "$work/repack"
        sed -i -E "s/^Version: .*/Version: $1/; s/\(= [^)]*\)/(= $1)/" "$work/repack/DEBIAN/control"
        dpkg-deb --root-owner-group -b "$work/repack" "$root/build/$1" >/dev/null
    done
    rm -rf "$work/repack"
}
for step in "upgraded 99.0" "downgraded 0.0.1"; do
    read -r what version <<<"$step"
    say "$what to $version, beside a running daemon"
    repacked "$version"
    inside "echo '# mine' >>/etc/zorvane/zorvaned.conf; apt-get install -y -q --allow-downgrades /build/$version/*.deb" >"$work/$what.log" 2>&1 ||
        fail "not $what: $work/$what.log"
    inside 'systemctl stop; systemctl start && zorvanectl check && zorvanectl lookup org.example.notes --class data-app --user 1000' ||
        fail "the store is not whole when it is $what"
    [[ "$(kept)" == "$before" ]] || fail "what users keep has changed when it was $what: $(diff <(echo "$before") <(kept))"
    inside 'grep -q "# mine" /etc/zorvane/zorvaned.conf' || fail "the configuration was overwritten"
done

say "Removed, then purged: what users keep stays, and it says where"
inside 'systemctl stop'
inside 'apt-get remove -y -q zorvaned zorvane-tools zorvane-run libzorvane0' >"$work/remove.log" 2>&1 || fail "not removed: $work/remove.log"
[[ "$(kept)" == "$before" ]] || fail "a removal took what users keep"
inside 'apt-get purge -y -q zorvaned zorvane-tools zorvane-run libzorvane0' >"$work/purge.log" 2>&1 || fail "not purged: $work/purge.log"
grep -q 'containers and their records stay in /private/var/containers' "$work/purge.log" || fail "the purge does not say where they are"
[[ "$(kept)" == "$before" ]] || fail "a purge took what users keep"
[[ ! -e "$root/etc/zorvane/zorvaned.conf" && ! -e "$root/usr/sbin/zorvaned" ]] || fail "something of the packages stays"
echo "package-test: all as it should be"
