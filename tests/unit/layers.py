"""Who may know whom: every file that a source was compiled from, as the compiler wrote it down, against a table; what
the platform's library shows against the seam; and that the merge asks nothing of either library. A folder that is not in the table, or is gone, fails too."""
import os
import re
import subprocess
import sys

SOURCE, BUILD, PLATFORM, LIBRARY, MERGE = (os.path.realpath(path) for path in sys.argv[1:6])
SEAM = "platform/include/"
GROUND = ["ground/", SEAM]
WIRE = ["wire/", *GROUND]
MAPPING = ["mapping/", *GROUND]

# The longest prefix counts.
MAY_KNOW = {
    "src/": ["src/", "include/", SEAM],
    "src/Log.cpp": ["src/Log.h", "ground/LogLine.h"],
    "src/merge/": ["src/merge/", "include/libtavoportmap.h"],
    "platform/linux/": ["platform/linux/", *WIRE],
    "ground/": GROUND,
    "wire/": WIRE,
    "mapping/": MAPPING,
    "mapping/Plan.cpp": ["mapping/", "ground/Marks.h"],
    "programs/": ["programs/common/", *WIRE, *MAPPING],
    "cli/": ["cli/", "include/", "src/merge/", SEAM],
    "tests/": [""],
    "bench/": [""],
}


def compiled_from():
    """The files of each source, the source first."""
    if os.path.exists(f"{BUILD}/build.ninja"):
        text = subprocess.check_output(["ninja", "-C", BUILD, "-t", "deps"], text=True)
        for block in re.split(r"\n(?=\S)", text):
            yield block.split("\n    ")[1:]
    else:
        for folder, _, names in os.walk(BUILD):
            for name in names:
                if name.endswith(".o.d"):
                    with open(f"{folder}/{name}", encoding="utf-8") as file:
                        yield file.read().replace("\\\n", " ").split()[1:]


def inside(path):
    path = os.path.realpath(os.path.join(BUILD, path.strip()))
    return os.path.relpath(path, SOURCE) if path.startswith(SOURCE + "/") and not path.startswith(BUILD) else None


def broken_layers():
    unused = set(MAY_KNOW)
    for files in compiled_from():
        known = [path for path in map(inside, files) if path]
        if not known or known[0].startswith("docs/"):
            continue
        source = known[0]
        prefixes = [prefix for prefix in MAY_KNOW if source.startswith(prefix)]
        if not prefixes:
            yield f"{source} is in no folder of the table"
            continue
        prefix = max(prefixes, key=len)
        unused.discard(prefix)
        allowed = MAY_KNOW[prefix]
        if prefix == "programs/":  # a program knows its own folder, and what they all share
            allowed = [*allowed, os.path.dirname(source) + "/"]
        yield from (f"{source} knows {path}" for path in known[1:] if not path.startswith(tuple(allowed)))
    yield from (f"nothing was compiled from {prefix}" for prefix in unused - {"bench/"})  # built on request


def names(library, which):
    """The functions' bare names, those of the standard library and of the compiler left out."""
    lines = subprocess.check_output(["nm", "-D", "-C", which, library], text=True).splitlines()
    texts = [line[line.index(" ", 17) + 1 if which == "--defined-only" else 19:].split("@")[0] for line in lines]
    found = (re.match(r"(?:(?!std::)\w+::)*~?([A-Za-z]\w*)(\[abi:\w+\])?(\(.*)?$", text) for text in texts)
    return {match.group(1) for match in found if match}


def broken_seam():
    seam = set()
    for name in os.listdir(f"{SOURCE}/{SEAM}tavo"):
        with open(f"{SOURCE}/{SEAM}tavo/{name}", encoding="utf-8") as file:
            seam |= set(re.findall(r"\b(\w+)\(", file.read()))
    shown = names(PLATFORM, "--defined-only")
    yield from (f"the platform's library shows {name}, which no header of the seam has" for name in shown - seam)
    yield from (f"the seam's {name} is not in the platform's library"
                for name in names(LIBRARY, "--undefined-only") & seam - shown)


def broken_merge():
    """What the records' header declares beside the records is out of its reach."""
    for line in subprocess.check_output(["nm", "-uC", MERGE], text=True).splitlines():
        if re.match(r"\s+U (TLIB|TLib|TAVO|TestFunc|syslog)", line):
            yield f"the merge asks for {line.split()[1]} itself, and not its host"


faults = sorted({*broken_layers(), *broken_seam(), *broken_merge()})
print("\n".join(faults) or "every file knows only what it may")
sys.exit(bool(faults))
