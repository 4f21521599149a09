#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
"""clang-tidy over what is installed, and clang's warnings over tests and benchmarks, as a part of ./dev lint.

Most of a source's time goes into the headers that it includes, so sources with the same flags are judged several at once, one
behind the other in one file. A batch in which anything is found is halved, down to single sources, whose verdict alone
counts: sources that do not go together cost time, and add no finding. Names that would clash are kept in different batches.
A batch that was clean is not judged again while its text, its headers and the checks stay the same.

usage: tools/tidy.py BUILD [JOBS]    BUILD holds compile_commands.json, and gets what is made
"""
import hashlib
import json
import os
import re
import shlex
import subprocess
import sys
from concurrent.futures import ThreadPoolExecutor
from pathlib import Path

from house import ROOT, code_of

CHECKS = ROOT / ".clang-tidy"
INSTALLED = ("src/", "client/", "tools/")
BATCH_LINES = 3000  # some fifteen sources: beyond that little is left to be gained, and two processors are to end together
WORD = re.compile(r"[A-Za-z_]\w*")


class Source:
    def __init__(self, entry):
        path = Path(entry["directory"], entry["file"]).resolve()
        self.path, self.name = path, str(path.relative_to(ROOT))
        words = shlex.split(entry["command"])
        words = words[next(i for i, word in enumerate(words) if word.startswith("-")):]
        self.flags = tuple(word for i, word in enumerate(words) if word not in ("-c", "-o", entry["file"])
                           and words[i - 1] != "-o")
        if not self.name.startswith(("src/", "tests/")):
            self.flags += ("-iquote", str(path.parent))  # other sources include headers that lie beside them
        self.tidy = self.name.startswith(INSTALLED)
        text = path.read_text()
        self.headers = re.findall(r'(?m)^#include ".*', text)
        self.lines = text.count("\n")
        code = re.sub(r"(?m)^#.*", "", code_of(text))
        # Each name that looks like a variable or a parameter; warnings tell of one that hides another's name.
        self.local = set(re.findall(r"[\w>&*] [&*]*([A-Za-z_]\w*)(?= ?[=;,:){])", code))
        self.declared, self.variables = set(), set()
        # The style leaves what a namespace declares without indentation.
        for line in re.findall(r"(?m)^(?!namespace|using|extern|public|protected|private|static_assert|\}|TEST)\w.*", code):
            head = re.split(r"[=({\[;]", line)[0]
            for name in WORD.findall(head)[-1:]:
                if "::" + name not in line:
                    self.declared.add(name)
                    if is_variable(line, head):
                        self.variables.add(name)

    def clashes_with(self, other):
        return self.declared & other.declared or self.variables & other.local or other.variables & self.local


def is_variable(line, head):
    """Whether a line of a namespace declares one, not a type or a function, by what follows its name."""
    constant = re.match(r"(constexpr|const|inline|static|thread_local)\b", line) and line.endswith(";")
    return not re.match(r"(struct|class|enum|template)\b", line) and (line[len(head):len(head) + 1] != "(" or constant)


def batches_of(sources):
    batches = []
    for source in sorted(sources, key=lambda source: (source.path.parent, -source.lines)):
        for batch in batches:
            if (batch[0].flags, batch[0].tidy) == (source.flags, source.tidy) and \
                    sum(one.lines for one in batch) + source.lines <= BATCH_LINES and \
                    not any(source.clashes_with(one) for one in batch):
                batch.append(source)
                break
        else:
            batches.append([source])
    return sorted(batches, key=lambda batch: -sum(source.lines for source in batch))


def command_for(path, source):
    if source.tidy:
        # Without carets it does not count what it leaves out of other people's headers.
        return ["clang-tidy-19", "--quiet", f"--config-file={CHECKS}", str(path), "--", *source.flags, "-fno-caret-diagnostics"]
    return ["clang++-19", *source.flags, "-Werror", "-fsyntax-only", str(path)]


def run(command):
    done = subprocess.run(command, cwd=ROOT, stdout=subprocess.PIPE, stderr=subprocess.STDOUT, text=True, check=False)
    return done.returncode == 0, done.stdout


def stamp_of(path, source):
    """A digest of all that the verdict depends on, or nothing when the headers cannot be listed."""
    listed, rule = run(["clang++-19", *source.flags, "-M", str(path)])
    if not listed:
        return None
    digest = hashlib.sha256(CHECKS.read_bytes() + repr(command_for(path, source)).encode())
    for name in rule.replace("\\\n", " ").split()[1:]:
        digest.update(Path(name).read_bytes())
    return digest.hexdigest()


def write_batch(batch, path):
    # Headers come first: what one declares within a function is not to hide what a source before it has declared.
    headers = "\n".join(dict.fromkeys(header for source in batch for header in source.headers))
    path.write_text(headers + "".join(f'\n#line 1 "{source.path}"\n{source.path.read_text()}' for source in batch))


def judge(batch, work):
    """A text of the faults that were found, the first ones of a batch, and the stamps of all that was clean."""
    path = batch[0].path
    if len(batch) > 1:
        path = work / (hashlib.sha256(" ".join(source.name for source in batch).encode()).hexdigest()[:16] + ".cc")
        write_batch(batch, path)
    stamp = stamp_of(path, batch[0])
    if stamp and (work / stamp).exists():
        return "", [stamp]
    clean, output = run(command_for(path, batch[0]))
    if clean:
        if stamp:
            (work / stamp).touch()
        return "", [stamp] if stamp else []
    if len(batch) == 1:
        return output, []
    found, stamps = judge(batch[:len(batch) // 2], work)
    if not found:
        found, more = judge(batch[len(batch) // 2:], work)
        stamps += more
    if not found:
        first = next((line for line in output.splitlines() if "error:" in line), "")
        print(f"tools/tidy.py: clean, but not together: {' '.join(source.name for source in batch)}: {first}", flush=True)
        if stamp:
            (work / stamp).touch()
            stamps.append(stamp)
    return found, stamps


def main():
    build = Path(sys.argv[1])
    work = build / "tidy"
    work.mkdir(parents=True, exist_ok=True)
    entries = json.loads((build / "compile_commands.json").read_text())
    sources = {source.path: source for source in map(Source, entries) if not source.name.startswith("build/")}
    batches = batches_of(sources.values())
    if not any(source.tidy for source in sources.values()) or all(source.tidy for source in sources.values()):
        print(f"tools/tidy.py: {build}/compile_commands.json names no sources of programs, or none of tests")
        return 2
    with ThreadPoolExecutor(int(sys.argv[2]) if len(sys.argv) > 2 else os.cpu_count()) as pool:
        verdicts = list(pool.map(lambda batch: judge(batch, work), batches))
    clean = {stamp for _, stamps in verdicts for stamp in stamps}
    for left in work.iterdir():
        if left.name not in clean:
            left.unlink()
    print("".join(text for text, _ in verdicts), end="")
    print(f"tools/tidy.py: {len(sources)} sources in {len(batches)} batches")
    return 1 if any(text for text, _ in verdicts) else 0


if __name__ == "__main__":
    sys.exit(main())
