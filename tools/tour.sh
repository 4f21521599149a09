#!/bin/bash
# SPDX-License-Identifier: Apache-2.0
# A short tour for a person: starts the daemon on a throw-away root below build/, uses it through zorvanectl, kills it, starts
# it again, and says at each step what happened. Every step is checked; the first surprise ends the tour with the log.
# usage: tools/tour.sh FOLDER-OF-THE-BINARIES
set -euo pipefail
umask 022
binaries="$(readlink -f "${1:?folder of the binaries}")"
cd "$(dirname "$(readlink -f "${BASH_SOURCE[0]}")")/.."
root="$PWD/build/tour-root"
log="$root/private/var/root/Library/Logs/Zorvane/zorvaned.log"
console="$PWD/build/tour-console.log"
daemon=

say() { printf '\n\033[1m%s\033[0m\n' "$*"; }

fail() {
    echo "tour: $*" >&2
    echo "tour: the daemon's last words ($console):" >&2
    tail -n 20 "$console" >&2 || true
    exit 1
}

ending() {
    if [[ -n "$daemon" ]]; then
        kill -KILL "$daemon" 2>/dev/null || true
        wait "$daemon" 2>/dev/null || true
    fi
}
trap ending EXIT

# Shows the command as a person would type it, then its answer, kept in $answer.
ctl() {
    printf '$ zorvanectl %s\n' "$*"
    answer="$("$binaries/zorvanectl" --root "$root" "$@")" || fail "zorvanectl $* failed: $answer"
    printf '%s\n' "${answer//$root\//}"
}

# The first path below the root in the last answer.
pathInAnswer() {
    [[ "$answer" =~ $root/[^\"[:space:]]+ ]] || fail "no path in: $answer"
    printf '%s' "${BASH_REMATCH[0]}"
}

startDaemon() {
    "$binaries/zorvaned" --root "$root" --foreground "$@" 2>>"$console" &
    daemon=$!
    local try
    for ((try = 0; try < 100; ++try)); do
        "$binaries/zorvanectl" --root "$root" status >/dev/null 2>&1 && return 0
        kill -0 "$daemon" 2>/dev/null || fail "the daemon ended at once"
        sleep 0.05
    done
    fail "the daemon does not answer"
}

# The same for a program that is run in a sandbox.
run() {
    printf '$ zorvane-run %s\n' "${*//$PWD\//}"
    answer="$("$binaries/zorvane-run" --root "$root" "$@" 2>&1)" || fail "zorvane-run $* failed: $answer"
    answer="${answer//$root\//}"
    printf '%s\n' "${answer//$PWD\//}"
}

# Says why no sandbox can be made here; says nothing when one can.
whyNoSandbox() {
    local probe
    if ((EUID != 0)); then
        echo "only root can become other users"
    elif [[ ! -x /usr/bin/bwrap ]]; then
        echo "bubblewrap is not installed"
    elif [[ "$root" == /usr/* || "$root" == /etc/* ]]; then
        echo "the checkout lies where every sandbox sees it"
    elif ! probe="$(bwrap --unshare-pid --unshare-ipc --unshare-uts --ro-bind / / --proc /proc --dev /dev true 2>&1)"; then
        echo "namespaces are not allowed here (${probe%%$'\n'*})"
    fi
}

# Two applications of user 501 that share a group, until both drop it.
sandboxes() {
    local program=(--user 501 --read-only "$PWD/tools/tour" --) shared diary lists
    say "An installer registers what applications may share. zorvane-run, which a service manager calls, will ask for that."
    sed "s|/usr/sbin/zorvane-run|$binaries/zorvane-run|" packaging/examples/zorvane-run.plist \
        >"$root/etc/zorvane/zorvane-run.plist"
    mv "$root"/etc/zorvane/{zorvane-run.plist,identities.d/}
    ctl entitlements set org.example.notes --app-group group.org.example.household
    ctl entitlements set org.example.lists --app-group group.org.example.household
    run --identifier org.example.notes --dry-run "${program[@]}" "$PWD/tools/tour/notes"

    say "Both run, each in a sandbox of its own: they meet in their group, and nowhere else."
    run --identifier org.example.notes "${program[@]}" "$PWD/tools/tour/notes"
    diary="$notes/Documents/diary.txt"
    [[ "$(cat "$diary")" == "dear diary" && "$(stat -c %u "$diary")" == 501 ]] || fail "the diary is not there"
    run --identifier org.example.lists "${program[@]}" "$PWD/tools/tour/lists" "$diary"
    ctl lookup org.example.lists --class data-app --user 501
    lists="$(pathInAnswer)"
    echo "\$ zorvane-run --identifier org.example.notes --user 501 -- ls ${lists#"$root/"}"
    if answer="$("$binaries/zorvane-run" --root "$root" --identifier org.example.notes "${program[@]}" ls "$lists" 2>&1)"; then
        fail "notes sees the container of lists: $answer"
    fi
    echo "${answer//$root\//}"
    ctl groups org.example.notes --user 501
    shared="$(pathInAnswer)"
    [[ "$(wc -l <"$shared/basket.txt")" == 2 ]] || fail "the basket does not hold what both put into it"

    say "Who holds the group? It goes with the last one."
    ctl why org.example.notes
    ctl entitlements set org.example.lists --app-group group.org.example.other
    [[ -e "$shared/basket.txt" ]] || fail "the group's container went though notes holds the group"
    ctl why org.example.notes
    ctl entitlements set org.example.notes --app-group group.org.example.other
    [[ ! -e "$shared" ]] || fail "the group's container stays though nobody holds the group"
    grep "Last reference to group container group.org.example.household" "$log" | tail -n 1
    ctl empty-death-row
    [[ -z "$(find "$root" -name basket.txt)" ]] || fail "the basket is still somewhere"
}

# Measuring, replacing and wiping a container that has something in it.
lifecycle() {
    say "Measured, with a note attached to it; then replaced as a whole, and wiped."
    ctl usage --class data-app --user 501
    ctl info set org.example.notes favourite '"bread"' --class data-app --user 501
    ctl create org.example.notes --class data-app --user 501 --transient
    echo "rye bread" >"$(pathInAnswer)/Documents/shopping.txt"
    ctl replace org.example.notes --class data-app --user 501 --yes
    ctl lookup org.example.notes --class data-app --user 501
    notes="$(pathInAnswer)"
    [[ "$(cat "$notes/Documents/shopping.txt")" == "rye bread" ]] || fail "the new content is not there"
    ctl wipe org.example.notes --class data-app --user 501 --yes
    [[ -d "$notes/Documents" && ! -e "$notes/Documents/shopping.txt" ]] || fail "the container was not wiped"
}

# A stricter class for files of an application, asked for while the device is locked.
protection() {
    local answered="$root/tmp/answered" asking try
    say "The device is locked, and an installer asks for a stricter data-protection class: no answer yet."
    echo "secret" >"$notes/Documents/secret.txt"
    ctl lock-state 1
    echo '$ zorvanectl protect org.example.notes 1 --class data-app --user 501 &'
    "$binaries/zorvanectl" --root "$root" protect org.example.notes 1 --class data-app --user 501 >"$answered" &
    asking=$!
    for ((try = 0; try < 100; ++try)); do
        ctl protection org.example.notes --class data-app --user 501 >/dev/null
        [[ "$answer" == *pending* ]] && break
        sleep 0.05
    done
    ctl protection org.example.notes --class data-app --user 501
    [[ "$answer" == *pending* && ! -s "$answered" ]] || fail "the change does not wait"
    say "It is unlocked, and there is the answer."
    ctl lock-state 0
    wait "$asking" || fail "the change failed"
    cat "$answered"
    ctl protection org.example.notes --class data-app --user 501
    [[ "$answer" == *"recorded   1"* ]] || fail "the class is not recorded"
}

# A boot: what was meant to last until then goes. Not named after the command that does it to the machine.
nextBoot() {
    say "The device reboots. What was transient goes, and so does data that is nobody's."
    mkdir "$root/private/var/mobile/Containers/Data/Application/Junk"
    kill -KILL "$daemon"
    wait "$daemon" 2>/dev/null || true
    echo "\$ zorvaned --forget-boot"
    startDaemon --forget-boot
    [[ ! -e "$root/private/var/mobile/Containers/Data/Application/Junk" ]] || fail "the orphan is still there"
    [[ -z "$("$binaries/zorvanectl" --root "$root" list --class data-app --user 501 --transient | tail -n +2)" ]] ||
        fail "a transient container outlived the boot"
    ctl status
}

# The items below a folder of the root, indented by depth, directories with a slash.
tree() {
    (cd "$root" && find "$1" -mindepth 1 \( -type d -printf '%P/\n' \) -o -printf '%P\n') | LC_ALL=C sort |
        sed -E ':next; s|^( *)[^/ ][^/]*/([^/])|\1    \2|; t next'
}

rm -rf "$root"
mkdir -p "$root"/{etc/zorvane/identities.d,private/var/mobile,private/var/second,private/var/brevad,tmp}
: >"$console"
cat >"$root/etc/passwd" <<'TEXT'
root:x:0:0:root:/private/var/root:/bin/sh
mobile:x:501:501:Mobile User:/private/var/mobile:/bin/sh
second:x:502:502:Second User:/private/var/second:/bin/sh
TEXT
cat >"$root/etc/zorvane/identities.d/zorvanectl.plist" <<TEXT
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0">
<dict>
    <key>Identifier</key>
    <string>com.veltra.zorvanectl</string>
    <key>Executable</key>
    <string>$binaries/zorvanectl</string>
    <key>Entitlements</key>
    <dict>
        <key>com.veltra.private.Zorvane.allowed</key>
        <true/>
    </dict>
</dict>
</plist>
TEXT

say "A root of its own: ${root#"$PWD/"} holds two users and says who zorvanectl is. The daemon starts on it."
startDaemon --forget-boot
ctl status

say "An application of user 501 and one of user 502 get their containers."
ctl create org.example.notes --class data-app --user 501
notes="$(pathInAnswer)"
ctl create org.example.maps --class data-app --user 502

say "The first one writes a file. Nobody asks the daemon for that: the directory is its own."
echo "milk, bread" >"$notes/Documents/shopping.txt"
ls -l "$notes/Documents" | tail -n +2
ctl list --class data-app --user 501

say "The daemon is killed in the middle of its life: no signal it could handle, no time to write anything."
kill -KILL "$daemon"
wait "$daemon" 2>/dev/null || true
echo "\$ kill -KILL $daemon"
startDaemon

say "A new one finds both again, with what was in them."
ctl lookup org.example.notes --class data-app --user 501
[[ "$(pathInAnswer)" == "$notes" ]] || fail "the container moved"
[[ "$(cat "$notes/Documents/shopping.txt")" == "milk, bread" ]] || fail "the file changed"
ctl lookup org.example.maps --class data-app --user 502

say "A transient container is never used twice: asking again gives a fresh one, and the first goes to death row."
ctl create org.example.scratch --class data-app --user 501 --transient
scratch="$(pathInAnswer)"
echo draft >"$scratch/tmp/draft"
ctl create org.example.scratch --class data-app --user 501 --transient
[[ "$(pathInAnswer)" != "$scratch" && ! -e "$scratch" ]] || fail "the transient container was used again"

say "Death row is emptied in the background. This waits until it is."
ctl empty-death-row
[[ -z "$(ls -A "$root/private/var/root/Library/Caches/com.veltra.zorvaned/Dead")" ]] || fail "death row is not empty"

lifecycle
protection
nextBoot

if [[ -n "$(whyNoSandbox)" ]]; then
    say "Here two applications would run in sandboxes. This part is left out: $(whyNoSandbox)."
else
    sandboxes
fi

say "What lies on disk now (private/var):"
tree private/var

say "What the log says (without the users 503 to 510, which this root does not have):"
grep -v -e '<7>' -e 'getpwuid for uid' -e '(null)' "$log" | tail -n 12 | sed "s|$root/||g"

say "How it is, and the end: SIGTERM lets it finish what it does."
ctl status
kill -TERM "$daemon"
wait "$daemon" || fail "the daemon ended with status $?"
daemon=
echo "The daemon has ended. Its root stays at ${root#"$PWD/"}; the next tour starts anew."
