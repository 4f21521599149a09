#!/bin/bash
# SPDX-License-Identifier: Apache-2.0
# Tries the packages in a bare Debian 12 of its own: installed by the lines of the README, upgraded, downgraded, removed and
# purged, with what users keep compared at each step. With the packages of an older version, the downgrade is one to that, and
# clients built against either library talk through either library to either daemon. It boots under its own systemd, where the unit's filter of system calls
# kills at the first call that it does not let pass; where none boots, namespaces do, and a stand-in runs what the unit runs.
# Ends with the first surprise.
# usage: tools/package-test.sh PACKAGES WORK-FOLDER BARE-SYSTEM [PACKAGES-OF-AN-OLDER-VERSION]
set -euo pipefail
packages="$(readlink -f "${1:?folder of the packages}")"
work="$(readlink -m "${2:?work folder}")"
base="$(readlink -m "${3:?folder of the bare system}")"
older="$(readlink -f "${4:-$packages}")"
cd "$(dirname "$(readlink -f "${BASH_SOURCE[0]}")")/.."
# shellcheck source=tools/bare-system.sh
source tools/bare-system.sh
inOwnNamespaces tools/package-test.sh "$packages" "$work" "$base" "$older"
root="$work/root"
# The most that the unit may expose, in tenths, as systemd-analyze counts; and with the drop-in for devices.
exposureMax=24
exposureOfDeviceMax=20

fail() {
    echo "package-test: $*" >&2
    inside 'cat /zorvaned.console; journalctl -n 30 --no-pager -u zorvaned' 2>/dev/null >&2 || true
    exit 1
}
# In the bare system.
inside() {
    local enter=(chroot "$root")
    [[ -z "${first:-}" ]] || enter=(nsenter --target "$first" --mount --pid --uts --ipc)
    asInstalled "${enter[@]}" -- "$1"
}

# exposes TENTHS: whether the unit exposes no more than that.
exposes() { inside "systemd-analyze security --offline=true --threshold=$1 zorvaned.service >/dev/null"; }

bareSystem "$base" "$root" || fail "there is no bare system"
mkdir -p "$root/build/packages" "$root/etc/systemd/system/zorvaned.service.d"
cp "$packages"/*.deb "$root/build/packages/"
rm -f "$root"/build/packages/*-dbgsym_*.deb
printf '[Service]\nSystemCallErrorNumber=\nWatchdogSec=4\n' >"$root/etc/systemd/system/zorvaned.service.d/test.conf"

first=
if [[ -n "$(type -p systemd-nspawn)" ]]; then
    # A device's units have all capabilities and system calls; a container would lack some that sandboxes need.
    systemd-nspawn --quiet --register=no --keep-unit --capability=CAP_NET_ADMIN --system-call-filter=@keyring --directory="$root" --boot --console=pipe </dev/null >"$work/boot.log" 2>&1 &
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

# everyKindOfWork USER: each command of the tool, and what it needs of the unit.
everyKindOfWork() {
    inside "user=$1;"'set -e; ctl() { zorvanectl "$@" >/dev/null || { echo "zorvanectl $*" >&2; exit 1; }; }
    app=(org.example.notes --class data-app --user $user) other=(org.example.other --class data-app --user $user)
    mkdir -p /bundle; echo code >/bundle/program; ctl install org.example.notes /bundle --class bundle-app --yes
    ctl install org.example.notes /bundle --class bundle-app --yes
    ctl entitlements set org.example.notes --app-group group.org.example --system-group systemgroup.org.example --system-container
    ctl groups org.example.notes --user $user; ctl why org.example.notes; ctl create "${app[@]}"
    ctl create "${other[@]}"; ctl create "${other[@]}" --transient; ctl replace "${other[@]}" --yes; ctl wipe "${other[@]}" --yes
    ctl info set "${app[@]:0:1}" key 1 "${app[@]:1}"; ctl protect "${app[@]:0:1}" 1 "${app[@]:1}"; ctl usage --class data-app --user $user
    ctl repair "${app[@]}"; ctl regenerate "${app[@]}"; ctl list --class data-app --user $user; ctl metadata "${app[@]}"
    ctl delete "${other[@]}" --yes; ctl empty-death-row; ctl status; ctl check'
}
say "Every kind of work, under the unit's fences"
everyKindOfWork 1000 || fail "something does not work under the unit"
if [[ -n "$first" ]]; then
    sleep 6 # longer than the watchdog's patience
    [[ "$(inside 'systemctl show -P NRestarts zorvaned')" == 0 ]] || fail "the daemon fell"
    [[ "$(inside 'systemctl show -P StatusText zorvaned')" == "Serving /: "* ]] || fail "the run loop does not say how it is"
    exposes "$exposureMax" || fail "the unit exposes more than it did"

    say "The drop-in for devices, and a home where it lets one be"
    dropIn=/etc/systemd/system/zorvaned.service.d/device.conf
    inside "useradd --create-home --home-dir /private/var/bob --uid 1001 bob
        cp /usr/share/doc/zorvaned/examples/device.conf $dropIn && systemctl daemon-reload && systemctl restart zorvaned" ||
        fail "the daemon does not start with the drop-in"
    exposes "$exposureOfDeviceMax" || fail "the drop-in leaves more open than it says"
    everyKindOfWork 1001 || fail "something does not work with the drop-in"
    [[ "$(inside 'zorvanectl lookup org.example.notes --class data-app --user 1001')" == */private/var/bob/* ]] || fail "there is no container of the second user"
    inside "rm $dropIn; systemctl daemon-reload && systemctl restart zorvaned" || fail "the daemon does not start without the drop-in"
fi

say "A service in a sandbox that says when it is ready"
cat >"$root/etc/systemd/system/notes.service" <<'TEXT'
[Unit]
Requires=zorvaned.service
After=zorvaned.service
[Service]
Type=notify
WatchdogSec=1min
SuccessExitStatus=143
ExecStart=/usr/sbin/zorvane-run --identifier org.example.notes --user 1000 -- /usr/bin/python3 -c "import os, socket, time; \
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

# repacked FOLDER VERSION: the packages in FOLDER under another version.
repacked() {
    local package
    mkdir -p "$root/build/$2"
    for package in "$1"/*.deb; do
        [[ "$package" != *-dbgsym_* ]] || continue
        rm -rf "$work/repack"
        dpkg-deb -R "$package" "$work/repack"
        sed -i -E "s/^Version: .*/Version: $2/; s/\(= [^)]*\)/(= $2)/g; s/(libzorvane0) \(>= [^)]*\)/\1 (>= $2)/" "$work/repack/DEBIAN/control"
        dpkg-deb --root-owner-group -b "$work/repack" "$root/build/$2" >/dev/null
    done
    rm -rf "$work/repack"
}
# builtAgainst FOLDER NAME: the C example, built against the library in FOLDER, and that library, in the bare system's /NAME.
builtAgainst() {
    local library
    mkdir -p "$root/$2"
    for package in "$1"/libzorvane0_*.deb "$1"/libzorvane-dev_*.deb; do dpkg-deb -x "$package" "$work/$2"; done
    library="$(dirname "$(find "$work/$2" -name libzorvane.so)")"
    cc -std=c99 packaging/examples/client/notes.c -I "$work/$2/usr/include" -L "$library" -lzorvane -o "$root/$2/notes"
    cp "$library"/libzorvane.so.0* "$root/$2/"
    rm -rf "${work:?}/$2"
    sed "s|/usr/bin/zorvanectl|/$2/notes|; s|com.veltra.zorvanectl|org.example.notes|; s|<integer>0<|<integer>1000<|" \
        packaging/examples/zorvanectl.plist >"$root/etc/zorvane/identities.d/$2.plist"
}
# Each client through each library finds the same container, and its own count in it.
starts=0
clientsWork() {
    local client library answer
    for client in older newer; do
        for library in older newer; do
            answer="$(inside "setpriv --reuid=ann --regid=ann --clear-groups env LD_LIBRARY_PATH=/$library /$client/notes")" || fail "the $client client fails with the $library library $1"
            ((++starts))
            [[ "$answer" == "$notes, start $starts" ]] || fail "the $client client with the $library library says $answer $1"
        done
    done
}
inside 'echo "# mine" >>/etc/zorvane/zorvaned.conf'
builtAgainst "$older" older
builtAgainst "$packages" newer
notes="$(inside 'zorvanectl lookup org.example.notes --class data-app --user 1000 --json | python3 -c "import json, sys; print(json.load(sys.stdin)[\"path\"])"')"
clientsWork "beside the first daemon"
map="$(inside 'zorvanectl entitlements list; zorvanectl groups org.example.notes --user 1000')"
before="$(kept)"
for step in "upgraded 99.0 $packages" "downgraded 0.0.1 $older" "upgraded 99.1 $packages"; do
    read -r what version folder <<<"$step"
    say "${what^} to $version, beside a running daemon"
    repacked "$folder" "$version"
    inside "apt-get install -y -q --allow-downgrades -o Dpkg::Options::=--force-confold /build/$version/*.deb" >"$work/$what.log" 2>&1 || fail "not $what: $work/$what.log"
    inside 'systemctl restart zorvaned && zorvanectl check && zorvanectl lookup org.example.notes --class data-app --user 1000' ||
        fail "the store is not whole when it is $what"
    [[ "$(kept)" == "$before" ]] || fail "what users keep has changed when $what: $(diff <(echo "$before") <(kept))"
    [[ "$(inside 'zorvanectl entitlements list; zorvanectl groups org.example.notes --user 1000')" == "$map" ]] ||
        fail "the map has changed when $what"
    inside 'grep -q "# mine" /etc/zorvane/zorvaned.conf' || fail "the configuration was overwritten when $what"
    clientsWork "when $what"
    before="$(kept)" # with the count of the clients
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
