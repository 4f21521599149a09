#!/bin/bash
# SPDX-License-Identifier: Apache-2.0
# Tries the packages in a bare Debian 12 of its own: installed by the lines of the README, upgraded, downgraded, removed and
# purged, with what users keep compared at each step. It boots under its own systemd, where the unit's filter of system calls
# kills at the first call that it does not let pass; where none boots, namespaces do, and a stand-in runs what the unit runs.
# Ends with the first surprise.
# usage: tools/package-test.sh PACKAGES WORK-FOLDER
set -euo pipefail
packages="$(readlink -f "${1:?folder of the packages}")"
work="$(readlink -m "${2:?work folder}")"
cd "$(dirname "$(readlink -f "${BASH_SOURCE[0]}")")/.."
base="$work/base"
root="$work/root"
# The most that the unit may expose, in tenths, as systemd-analyze counts.
exposureMax=24

if [[ -z "${ZORVANE_PACKAGE_TEST:-}" ]]; then
    # All that is started ends with the first process of the namespace; its mounts go with it.
    ZORVANE_PACKAGE_TEST=1 exec unshare --mount --pid --fork --kill-child --mount-proc --propagation private \
        tools/package-test.sh "$packages" "$work"
fi

fail() {
    echo "package-test: $*" >&2
    inside 'cat /zorvaned.console; journalctl -n 30 --no-pager -u zorvaned' 2>/dev/null >&2 || true
    exit 1
}
say() { printf '\n== %s\n' "$*"; }
# In the bare system, with nothing of this one's surroundings.
inside() {
    local enter=(chroot "$root")
    [[ -z "${first:-}" ]] || enter=(nsenter --target "$first" --mount --pid --uts --ipc)
    "${enter[@]}" /usr/bin/env -i PATH=/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin HOME=/root \
        DEBIAN_FRONTEND=noninteractive LC_ALL=C.UTF-8 bash -c "$1"
}

if [[ ! -e "$base/usr" ]]; then
    say "A bare Debian 12"
    mirror="$(grep -rhoE 'https?://[^ ]*/debian/?( |$)' /etc/apt/sources.list /etc/apt/sources.list.d 2>/dev/null | head -n 1)"
    rm -rf "$work/base.new"
    mkdir -p "$work"
    debootstrap --variant=minbase --include=systemd-sysv,dbus bookworm "$work/base.new" \
        "${mirror:-http://deb.debian.org/debian}" >"$work/debootstrap.log" 2>&1 || fail "no bare system: $work/debootstrap.log"
    chroot "$work/base.new" apt-get clean
    mv "$work/base.new" "$base"
fi
rm -rf "$root"
cp -a "$base" "$root"
mkdir -p "$root/build/packages" "$root/etc/systemd/system/zorvaned.service.d"
cp "$packages"/*.deb "$root/build/packages/"
rm -f "$root"/build/packages/*-dbgsym_*.deb "$root/etc/resolv.conf"
cp -L /etc/resolv.conf "$root/etc/resolv.conf"
printf '[Service]\nSystemCallErrorNumber=\nWatchdogSec=4\n' >"$root/etc/systemd/system/zorvaned.service.d/test.conf"

first=
if [[ -n "$(type -p systemd-nspawn)" ]]; then
    systemd-nspawn --quiet --register=no --keep-unit --directory="$root" --boot --console=pipe </dev/null >"$work/boot.log" 2>&1 &
    for ((try = 0; try < 100; ++try)); do
        first="$(pgrep -P $! 2>/dev/null | head -n 1)" || true
        [[ -n "$first" && "$(inside 'systemctl is-system-running' 2>/dev/null)" =~ ^(running|degraded)$ ]] && break
        first=
        sleep 0.2
    done
fi
if [[ -z "$first" ]]; then
    echo "package-test: no systemd boots here; a stand-in runs what the unit runs"
    mount --bind "$root" "$root" # sandboxes need a mount point
    mount -t proc proc "$root/proc"
    for place in run dev/shm; do mount -t tmpfs -o mode=0755 tmpfs "$root/$place"; done
    printf '#!/bin/sh\nexit 101\n' >"$root/usr/sbin/policy-rc.d" # maintainer scripts start nothing
    cat >"$root/usr/local/bin/systemctl" <<'TEXT'
#!/bin/bash
[[ ! -e /run/zorvaned.pid ]] || kill "$(</run/zorvaned.pid)" 2>/dev/null
[[ "$1" =~ start ]] || exit 0
rm -f /run/zorvane/zorvaned.status
setsid $(sed -n 's/^ExecStart=//p' /lib/systemd/system/zorvaned.service) </dev/null >>/zorvaned.console 2>&1 &
echo $! >/run/zorvaned.pid
for ((try = 0; try < 200; ++try)); do [[ -S /run/zorvane/zorvaned.status ]] && exit; sleep 0.1; done
exit 1
TEXT
    chmod 755 "$root/usr/sbin/policy-rc.d" "$root/usr/local/bin/systemctl"
fi

# A device has a process 3, a thread of its kernel. The launcher's bubblewrap looks its own child up in the /proc of outside, so
# that without any process of this number no sandbox is made in a container.
third='echo 2 >/proc/sys/kernel/ns_last_pid; setsid sleep infinity >/dev/null 2>&1 </dev/null & sleep 0.2; [[ -e /proc/$!/stat ]]'
if [[ -n "$first" ]]; then nsenter --target "$first" --pid bash -c "$third"; else bash -c "$third"; fi || true

say "The lines of the README, as they stand"
lines="$(sed -n '/^<!-- .*runs these lines/,/^```$/p' README.md | sed '1,2d;$d')"
[[ "$lines" == *zorvane-run* ]] || fail "README.md has no lines to run"
inside "apt-get -q update >/dev/null" || fail "no package lists"
inside "set -eux; cd /; $lines" >"$work/readme.log" 2>&1 || { tail -n 15 "$work/readme.log"; fail "a line of the README failed"; }
tail -n 12 "$work/readme.log"
list="$(find "$root/home/ann/Containers" -name list)"
[[ "$(<"$list")" == milk ]] || fail "the program's file is not in its container"
[[ "$(inside 'stat -c %U /private/var/brevad')" == zorvane-installer ]] || fail "transient bundles belong to somebody else"

say "The library and its Python module"
inside 'python3 -c "import zorvane; print(zorvane.Client().status()[\"Peer\"])"' ||
    fail "a program of others does not reach the daemon"

say "Every kind of work, under the unit's fences"
inside 'set -e; ctl() { zorvanectl "$@" >/dev/null || { echo "zorvanectl $*" >&2; exit 1; }; }
    app=(org.example.notes --class data-app --user 1000)
    mkdir /bundle; echo code >/bundle/program; ctl install org.example.notes /bundle --class bundle-app --yes
    ctl install org.example.notes /bundle --class bundle-app --yes
    ctl entitlements set org.example.notes --app-group group.org.example --system-group systemgroup.org.example --system-container
    ctl groups org.example.notes --user 1000; ctl why org.example.notes
    ctl create org.example.other --class data-app --user 1000; ctl create org.example.other --class data-app --user 1000 --transient
    ctl replace org.example.other --class data-app --user 1000 --yes; ctl wipe org.example.other --class data-app --user 1000 --yes
    ctl info set "${app[@]:0:1}" key 1 "${app[@]:1}"; ctl protect "${app[@]:0:1}" 1 "${app[@]:1}"; ctl usage --class data-app --user 1000
    ctl repair "${app[@]}"; ctl regenerate "${app[@]}"; ctl list --class data-app --user 1000; ctl metadata "${app[@]}"
    ctl delete org.example.other --class data-app --user 1000 --yes; ctl empty-death-row; ctl status; ctl check' ||
    fail "something does not work under the unit"
if [[ -n "$first" ]]; then
    sleep 6 # longer than the watchdog's patience
    [[ "$(inside 'systemctl show -P NRestarts zorvaned')" == 0 ]] || fail "the daemon fell"
    [[ "$(inside 'systemctl show -P StatusText zorvaned')" == "Serving /: "* ]] || fail "the run loop does not say how it is"
    inside "systemd-analyze security --offline=true --threshold=$exposureMax zorvaned.service >/dev/null" || fail "the unit exposes more than it did"
fi

say "A service in a sandbox that says when it is ready"
cat >"$root/etc/systemd/system/notes.service" <<'TEXT'
[Unit]
Requires=zorvaned.service
After=zorvaned.service
[Service]
Type=notify
WatchdogSec=1min
ExecStart=/usr/sbin/zorvane-run --identifier org.example.notes --user 1000 -- /usr/bin/python3 -c "\
import os, socket, time; \
manager = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM); \
manager.sendto(('READY=1\\nSTATUS=at home in ' + os.getcwd()).encode(), os.environ['NOTIFY_SOCKET']); \
time.sleep(60)"
TEXT
if [[ -n "$first" ]]; then
    inside 'systemctl daemon-reload && systemctl start notes' || fail "the service did not say that it is ready"
    [[ "$(inside 'systemctl show -P StatusText notes')" == "at home in /home/ann/Containers/"* ]] || fail "the service's state is not known"
    inside 'systemctl stop notes && [[ "$(systemctl show -P Result notes)" == success ]]' || fail "the service did not end when it was told to"
fi

# The files of users, by name, owner and content.
kept() {
    (cd "$root" && find home private/var/containers private/var/root/Library/Zorvane -type f -printf '%p %U %m\n' -exec sha256sum {} + | sort)
}
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
inside 'echo "# mine" >>/etc/zorvane/zorvaned.conf'
for step in "upgraded 99.0" "downgraded 0.0.1"; do
    read -r what version <<<"$step"
    say "${what^} to $version, beside a running daemon"
    repacked "$version"
    inside "apt-get install -y -q --allow-downgrades /build/$version/*.deb" >"$work/$what.log" 2>&1 || fail "not $what: $work/$what.log"
    inside 'systemctl restart zorvaned && zorvanectl check && zorvanectl lookup org.example.notes --class data-app --user 1000' ||
        fail "the store is not whole when it is $what"
    [[ "$(kept)" == "$before" ]] || fail "what users keep has changed when $what: $(diff <(echo "$before") <(kept))"
    inside 'grep -q "# mine" /etc/zorvane/zorvaned.conf' || fail "the configuration was overwritten when $what"
done

say "Removed, then purged: what users keep stays, and it says where"
programs="zorvaned zorvane-tools zorvane-run"
for step in "remove apt-get -y -q remove $programs libzorvane0" "purge dpkg --purge $programs"; do
    read -r step command <<<"$step"
    inside "$command" >"$work/$step.log" 2>&1 || fail "no $step: $work/$step.log"
    [[ "$(kept)" == "$before" ]] || fail "$step took what users keep"
done
grep 'containers and their records stay in /private/var/containers' "$work/purge.log" || fail "the purge does not say where they are"
[[ ! -e "$root/etc/zorvane/zorvaned.conf" && ! -e "$root/usr/sbin/zorvaned" ]] || fail "something of the packages stays"
echo "package-test: all as it should be"
