#!/usr/bin/env python3
"""Fails on an include that runs up the layers, and on time, threads or Linux where they do not belong.

usage: layering.py [ROOT]    checks itself on known faults first, then the sources below ROOT
"""
import pathlib
import re
import sys

# What each layer may include besides itself; the longest matching folder decides a file's layer.
ALLOWED = {
    "tools/sablectl": {"SableKit", "platform"},
    "tools/sable-service": set(),
    "sabled": {"SableKit", "platform"},
    "SableKit": {"platform"},
    "platform/host": {"platform"},
    "platform/simulated": {"platform"},
    "platform": set(),
}
# Only a program's main.cpp picks an implementation.
MAIN = {"sabled/main.cpp": {"platform/host"}, "tools/sablectl/main.cpp": {"platform/host"}}
# The reference service includes its own headers by bare name; everything else is named from the root.
BARE = {"tools/sable-service"}
FORBIDDEN = re.compile(r"std::j?thread\b|std::this_thread\b|\b(?:u|nano)?sleep\s*\(|_clock::now\b|std::random_device\b"
                       r"|#\s*include\s*<(?:unistd\.h|sys/[^>]*|linux/[^>]*|thread|random)>")
INCLUDE = re.compile(r'\s*#\s*include\s*"([^"]+)"')


def layer_of(path):
    return next((layer for layer in ALLOWED if path.startswith(layer + "/")), None)


def faults(path, text):
    """The faults of one source, as "path:line: what is wrong"."""
    layer = layer_of(path)
    text = re.sub(r"/\*.*?\*/", lambda comment: "\n" * comment[0].count("\n"), text, flags=re.S)
    for number, line in enumerate(text.split("\n"), 1):
        line = re.sub(r"(?<!:)//.*", "", line)
        if include := INCLUDE.match(line):
            target = layer_of(include[1])
            if "/" not in include[1] and layer in BARE:
                continue
            if target is None:
                yield f"{path}:{number}: \"{include[1]}\" is not named from the root"
            elif target not in ALLOWED[layer] | {layer} | MAIN.get(path, set()):
                yield f"{path}:{number}: {layer} must not include {target}: \"{include[1]}\""
        if layer in ("sabled", "SableKit") and (found := FORBIDDEN.search(line)):
            yield f"{path}:{number}: {found[0].strip()} belongs behind the platform"


KNOWN = {  # path, text: the lines at fault
    ("sabled/A.cpp", '#include "platform/Log.h"\n#include "platform/host/Reactor.h"\n#include <sys/epoll.h>'): [2, 3],
    ("sabled/main.cpp", '#include "platform/host/Reactor.h"\n#include "platform/simulated/World.h"'): [2],
    ("sabled/B.cpp", "// std::thread\nstd::thread t;\nsleep(1);\nsystem_clock::now();\nsleepy();"): [2, 3, 4],
    ("SableKit/C.h", '#include "sabled/A.h"\n#include "SableKit/D.h"\n#include "D.h"'): [1, 3],
    ("platform/D.h", '#include "SableKit/C.h"\n  #  include "platform/host/Reactor.h"'): [1, 2],
    ("platform/host/E.cpp", '#include "platform/simulated/World.h"\n#include <sys/epoll.h>\n#include "platform/D.h"'): [1],
    ("tools/sablectl/F.cpp", '#include "sabled/A.h"\n#include "platform/host/Reactor.h"'): [1, 2],
    ("tools/sable-service/G.cpp", '#include "Index.h"\n#include "SableKit/C.h"\n#include "platform/D.h"'): [2, 3],
}


def main(root):
    for (path, text), lines in KNOWN.items():
        found = [int(fault.split(":")[1]) for fault in faults(path, text)]
        if found != lines:
            sys.exit(f"layering: blind in {path}: should see the faults in lines {lines}, sees {found}")
    tops = {layer.split("/")[0] for layer in ALLOWED}
    below = sorted(path for top in tops for path in (root / top).rglob("*"))
    sources = [p for p in below if p.suffix in (".h", ".cpp") and layer_of(str(p.relative_to(root)))]
    found = [fault for p in sources for fault in faults(str(p.relative_to(root)), p.read_text())]
    print("\n".join(found + [f"{len(sources)} sources, {len(found)} faults"]))
    return 1 if found or not sources else 0


if __name__ == "__main__":
    sys.exit(main(pathlib.Path(sys.argv[1] if len(sys.argv) > 1 else ".").resolve()))
