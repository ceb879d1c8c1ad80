#!/usr/bin/env python3
"""Checks that the #include lines of the project named keep the direction of dependencies (docs/architecture.md)."""
import pathlib
import re
import sys

STANDARD = r"<[^/.]+>"  # the C++ standard library's headers alone have neither '/' nor ".h" in the name
# What may stand behind #include in files whose path begins so; the first that fits counts. The mains wire the Linux
# implementations in. Where nothing but the standard library is for use, nothing is compiled conditionally either.
RULES = {
    "platform/linux/": (False, r'<|"platform/'),
    "platform/": (True, STANDARD + r'|"platform/(?!linux/)'),
    "Zembra/": (True, STANDARD + r'|"(platform/(?!linux/)|Zembra/)'),
    "zbd/main.cpp": (True, r'<|"(platform|Zembra|zbd)/'),
    "zbd/": (True, STANDARD + r'|"(platform/(?!linux/)|Zembra/|zbd/)'),
    "tools/": (False, r'<|"(platform|Zembra|tools)/'),
    "samples/": (False, r'<|"(platform|Zembra|samples)/'),
}

root = pathlib.Path(sys.argv[1])
faults, seen = [], 0
for path in sorted([*root.rglob("*.h"), *root.rglob("*.cpp")]):
    relative = str(path.relative_to(root))
    unconditional, allowed = next((rule for start, rule in RULES.items() if relative.startswith(start)), (False, ""))
    seen += allowed != ""
    for number, line in enumerate(path.read_text(encoding="utf-8").splitlines(), 1):
        include = re.match(r"\s*#\s*include\s*(.*)", line)
        if include and not re.match(allowed, include[1]):
            faults.append(f"{relative}:{number}: {line.strip()}")
        if unconditional and re.match(r"\s*#\s*if(n?def)?\b(?!.*__cplusplus)", line):
            faults.append(f"{relative}:{number}: conditional compilation: {line.strip()}")
print("\n".join(faults) if faults else f"{seen} files keep the direction of dependencies")
sys.exit(1 if faults or not seen else 0)
