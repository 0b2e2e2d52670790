#!/usr/bin/env python3
"""Checks that no header of the library includes upward.

The rooms of src/ stand on floors (docs/architecture.md). A header includes its own room and lower
floors only; a source may look one floor up; a source that registers itself and that nothing
includes may look anywhere, and is listed here.
"""

import pathlib
import re
import sys

# First match wins; a path is relative to src/.
FLOORS = [
    (r"core/(0ReusePool|ReusePoolInternal|SpinLock|Text|Export|Annotations|Faults|NumbersInternal)", 0),
    (r"Platform/(Files|Processes|Strings)", 1),
    (r"Platform/Thread\.", 3),
    (r"Platform/", 0),
    (r"textform/", 0),
    (r"core/(OxID|OxString|MemBlock|Numbers|Script)", 1),
    (r"diag/Env", 1),
    (r"objects/", 2),
    (r"core/(RefObject|TagList|TagMap)", 3),
    (r"(diag|layout|paths)/", 4),
    (r"remote/", 5),
    (r"runtime/lua/", 6.1),
    (r"runtime/python/", 6.2),
    (r"runtime/", 6),
    (r"ffi/", 7),
    (r"tools/", 8),
]
SEPARATE_ROOMS = {"diag", "layout", "paths"}  # on one floor, and none knows another
LOOKS_UP = set()  # sources that register themselves

INCLUDE = re.compile(r'^\s*#\s*include\s+"([^"]+)"', re.MULTILINE)


def floor_of(path):
    for pattern, floor in FLOORS:
        if re.match(pattern, path):
            return floor
    sys.exit(f"{path}: on no floor; add it to {sys.argv[0]}")


def main():
    source_root = pathlib.Path(__file__).parent.parent / "src"
    faults = []
    for file in sorted(source_root.rglob("*.[hc]*")):
        if file.suffix not in (".h", ".cpp"):
            continue
        path = file.relative_to(source_root).as_posix()
        if path in LOOKS_UP:
            continue
        allowed = floor_of(path) + (1 if file.suffix == ".cpp" else 0)
        for included in INCLUDE.findall(file.read_text()):
            room, other = path.split("/")[0], included.split("/")[0]
            if not (source_root / included).exists():
                faults.append(f"{path}: no such header: {included}")
            elif floor_of(included) > allowed:
                faults.append(f"{path}: includes upward: {included}")
            elif room != other and room in SEPARATE_ROOMS and other in SEPARATE_ROOMS \
                    and floor_of(included) == 4:
                faults.append(f"{path}: includes a neighbour: {included}")
    print("\n".join(faults) or "includes: in order")
    return 1 if faults else 0


if __name__ == "__main__":
    sys.exit(main())
