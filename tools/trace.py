#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
"""Counts, for some requests, the sources whose functions the daemon enters and the calls that cross a folder's border.

usage: tools/trace.py FOLDER-OF-THE-BINARIES [--calls REQUEST]

The binaries are those of the trace preset (./dev trace). A real daemon serves a root below build/, asked by zorvanectl.
A request is what the daemon's thread does from the message to its reply: all that the command's handler calls. One that
is answered for the first time does more than the next; both are shown. --calls prints the calls of one request, as a tree.
"""

import collections
import os
import pathlib
import shutil
import struct
import subprocess
import sys
import time

HERE = pathlib.Path(__file__).resolve().parent
ROOT = HERE.parent / "build" / "trace-root"
HEADER, RECORD = 16, struct.Struct("<QII")
HANDLERS = "src/daemon/commands/"
# The handlers of the requests that are shown, and what to call them.
STEPS = [
    ("create", ["create", "org.example.trace", "--class", "data-app"]),
    ("lookup, the first", ["lookup", "org.example.trace", "--class", "data-app"]),
    ("lookup", ["lookup", "org.example.trace", "--class", "data-app"]),
    ("transient for a replace", ["create", "org.example.trace", "--class", "data-app", "--transient"]),
    ("replace", ["replace", "org.example.trace", "--class", "data-app", "--yes"]),
    ("staged deletion", ["delete", "org.example.trace", "--class", "data-app", "--yes"]),
]


class Trace:
    """The records of a running daemon, and where its functions are written."""

    def __init__(self, program, path):
        self.program, self.path, self.places = program, path, {}

    def count(self):
        with open(self.path, "rb") as file:
            return struct.unpack("<Q", file.read(8))[0]

    def records(self, begin, end):
        with open(self.path, "rb") as file:
            file.seek(HEADER + begin * RECORD.size)
            return list(RECORD.iter_unpack(file.read((end - begin) * RECORD.size)))

    def learn(self, addresses):
        unknown = [address for address in addresses if address not in self.places]
        lines = subprocess.run(["addr2line", "-f", "-C", "-e", self.program], check=True, text=True, capture_output=True,
                               input="\n".join(map(hex, unknown))).stdout.splitlines()
        for address, function, place in zip(unknown, lines[0::2], lines[1::2]):
            file = os.path.relpath(place.split(":")[0], HERE.parent) if place[0] == "/" else place
            self.places[address] = (function, file)


def requests(trace, begin, end):
    """For each command's handler that was called: its calls as (depth, function, file), itself the first."""
    records = trace.records(begin, end)
    trace.learn({address for address, _, _ in records})
    found, stacks, open_ = [], collections.defaultdict(list), {}
    for address, thread, is_entry in records:
        stack = stacks[thread]
        if is_entry:
            function, file = trace.places[address]
            stack.append(address)
            if thread not in open_ and file.startswith(HANDLERS) and file.endswith("Commands.cc"):
                open_[thread] = (len(stack), [])
            if thread in open_:
                open_[thread][1].append((len(stack) - open_[thread][0], function, file))
        else:
            if stack:
                stack.pop()
            if thread in open_ and len(stack) < open_[thread][0]:
                found.append(open_.pop(thread)[1])
    return found


def figures(calls):
    """(files, crossings): the sources that a reader of the request opens, and the calls into another folder's.

    What a header holds whole, an accessor or a lock's guard, needs no opening; its own calls count for its caller.
    """
    files, folders, crossings = set(), [], 0
    for depth, _, file in calls:
        del folders[depth:]
        caller = folders[-1] if folders else None
        if not file.startswith("src/") or file.endswith(".h"):
            folders.append(caller)
            continue
        files.add(file)
        folder = os.path.dirname(file)
        crossings += caller not in (None, folder)
        folders.append(folder)
    return len(files), crossings


def main():
    binaries = pathlib.Path(sys.argv[1]).resolve()
    shown = sys.argv[3] if sys.argv[2:3] == ["--calls"] else None
    shutil.rmtree(ROOT, ignore_errors=True)
    ROOT.mkdir(parents=True)
    ctl = [str(binaries / "zorvanectl"), "--root", str(ROOT)]
    subprocess.run([*ctl, "init"], check=True, stdout=subprocess.DEVNULL)
    tracer, records = ROOT.parent / "trace" / "Tracer.so", ROOT.parent / "trace" / "records"
    subprocess.run(["g++", "-std=c++23", "-O2", "-shared", "-fPIC", str(HERE / "trace" / "Tracer.cc"), "-o", str(tracer)],
                   check=True)
    program = str(binaries / "zorvaned")
    daemon = subprocess.Popen([program, "--root", str(ROOT), "--foreground"], stderr=subprocess.DEVNULL,
                              env={**os.environ, "LD_PRELOAD": str(tracer), "ZORVANE_TRACE": str(records)})
    try:
        for _ in range(200):
            if subprocess.run([*ctl, "status"], capture_output=True).returncode == 0:
                break
            time.sleep(0.05)
        trace = Trace(program, records)
        print(f"{'request':48} {'files':>6} {'crossings':>10}")
        for name, words in STEPS:
            begin = trace.count()
            subprocess.run([*ctl, *words], check=True, stdout=subprocess.DEVNULL)
            time.sleep(0.3)
            for calls in requests(trace, begin, trace.count()):
                files, crossings = figures(calls)
                handler = calls[0][1].split("(")[0].split("::")[-1]
                print(f"{name + ': ' + handler:48} {files:>6} {crossings:>10}")
                if shown == name:
                    for depth, function, file in calls:
                        print(f"  {'  ' * depth}{function.split('(')[0]}  {file}")
    finally:
        daemon.terminate()
        daemon.wait()


if __name__ == "__main__":
    main()
