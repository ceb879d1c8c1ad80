#!/usr/bin/env python3
"""Checks that the #include lines keep the direction of dependencies (docs/architecture.md).

usage: includes.py PROJECT
"""
import pathlib
import re
import sys

# What files of a folder may include with quotes, as prefixes.
QUOTED = {
    "platform": ("platform/",),
    "platform/linux": ("platform/",),
    "Zembra": ("platform/", "Zembra/"),
    "zbd": ("platform/", "Zembra/", "zbd/"),
    "tools": ("platform/", "Zembra/", "tools/"),
    "samples": ("platform/", "Zembra/", "samples/"),
}
# Folders whose angle-bracket includes must be the C++ standard library's: no '/' and no ".h" in the name.
STANDARD_ONLY = ("platform", "Zembra", "zbd")
# The mains wire the Linux implementations in.
MAINS = {"zbd/main.cpp"}


def folder_of(path):
    folder = str(path.parent)
    while folder not in QUOTED:
        if folder in (".", ""):
            return None
        folder = str(pathlib.Path(folder).parent)
    return folder


def main():
    root = pathlib.Path(sys.argv[1])
    faults, seen = [], 0
    for path in sorted(root.rglob("*")):
        relative = path.relative_to(root)
        if path.suffix not in (".h", ".cpp") or relative.parts[0] not in ("platform", "Zembra", "zbd", "tools", "samples"):
            continue
        folder = folder_of(relative)
        if folder is None:
            continue
        seen += 1
        for number, line in enumerate(path.read_text(encoding="utf-8").splitlines(), 1):
            if folder in STANDARD_ONLY and re.match(r"\s*#\s*if(n?def)?\b(?!.*__cplusplus)", line):
                faults.append(f"{relative}:{number}: conditional compilation: {line.strip()}")
            match = re.match(r'\s*#\s*include\s*([<"])([^">]+)[">]', line)
            if not match:
                continue
            kind, name = match.groups()
            if kind == '"':
                allowed = name.startswith(QUOTED[folder])
                linux = name.startswith("platform/linux/")
                if linux and folder in STANDARD_ONLY and str(relative) not in MAINS:
                    allowed = False
            else:
                allowed = folder not in STANDARD_ONLY or str(relative) in MAINS or not re.search(r"[/.]", name)
            if not allowed:
                faults.append(f"{relative}:{number}: {line.strip()}")
    print("\n".join(faults) if faults else f"{seen} files keep the direction of dependencies")
    return 1 if faults or not seen else 0


sys.exit(main())
