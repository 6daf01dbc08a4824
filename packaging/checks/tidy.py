#!/usr/bin/env python3
"""Runs clang-tidy on the product's sources, and again only on those whose outcome may have changed.

usage: tidy.py BUILD-FOLDER

An outcome depends on the source, on every header it includes, on how it is compiled, on the settings and on
clang-tidy itself. Ninja has recorded the headers while it built; a hash over all of these names a stamp in
build/tidy, and a source that has its stamp has passed as it is.
"""
import concurrent.futures
import functools
import hashlib
import json
import os
import pathlib
import shlex
import subprocess
import sys

ROOT = pathlib.Path(__file__).resolve().parents[2]
STAMPS = ROOT / "build/tidy"
# What g++ accepts is settled by the build; here only clang-tidy's own checks are errors. The analyzer follows a
# third of the states that it would, which saves a third of the time.
ARGUMENTS = ["--quiet", "--extra-arg=-Wno-unknown-warning-option", "--extra-arg=-Wno-error",
             *("--extra-arg=" + word for word in "-Xclang -analyzer-config -Xclang max-nodes=75000".split())]
PRODUCT = ("sabled", "SableKit", "platform", "tools")


def recorded_headers(build):
    """Object file -> the headers Ninja has seen it include."""
    headers, current = {}, []
    listing = subprocess.run(["ninja", "-C", build, "-t", "deps"], capture_output=True, text=True, check=True).stdout
    for line in listing.splitlines():
        if line.startswith("    "):
            current.append(line.strip())
        elif ": #deps" in line:
            current = headers.setdefault(line.split(": #deps")[0], [])
    return headers


@functools.cache
def digest(path):
    """Of the project's files the content counts, of the system's only which version it is."""
    if path.is_relative_to(ROOT):
        return hashlib.sha256(path.read_bytes()).hexdigest()
    about = path.stat()
    return f"{path} {about.st_size} {about.st_mtime_ns}"


def object_of(command):
    words = shlex.split(command["command"])
    return words[words.index("-o") + 1]


def key(command, headers, common):
    folder = pathlib.Path(command["directory"])
    files = sorted({(folder / name).resolve() for name in headers} | {pathlib.Path(command["file"])})
    text = "\n".join([common, command["command"], *(digest(path) for path in files)])
    return hashlib.sha256(text.encode()).hexdigest()


def tidy(command, build):
    run = subprocess.run(["clang-tidy", *ARGUMENTS, "-p", build, command["file"]],
                         stdout=subprocess.PIPE, stderr=subprocess.DEVNULL, text=True)
    return run.returncode == 0, run.stdout


def main(build):
    commands = [c for c in json.loads(pathlib.Path(build, "compile_commands.json").read_text())
                if os.path.relpath(c["file"], ROOT).split("/")[0] in PRODUCT]
    version = subprocess.run(["clang-tidy", "--version"], capture_output=True, text=True, check=True).stdout
    settings = "".join(path.read_text() for path in (ROOT / ".clang-tidy", ROOT / "tools/.clang-tidy"))
    common = version + " ".join(ARGUMENTS) + settings
    headers = recorded_headers(build)
    STAMPS.mkdir(parents=True, exist_ok=True)
    due = {key(c, headers.get(object_of(c), []), common): c for c in commands}
    due = {stamp: command for stamp, command in due.items() if not (STAMPS / stamp).exists()}
    failed = 0
    with concurrent.futures.ThreadPoolExecutor(os.cpu_count()) as pool:
        for stamp, (clean, output) in zip(due, pool.map(lambda command: tidy(command, build), due.values())):
            if clean:
                (STAMPS / stamp).touch()
            else:
                failed += 1
                print(output, end="")
    print(f"note: {len(commands)} sources, {len(due)} looked at, {failed} at fault")
    return 1 if failed or not commands else 0


if __name__ == "__main__":
    sys.exit(main(sys.argv[1]))
