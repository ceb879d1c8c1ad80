#!/usr/bin/env bash
# Formats the sources, or with --check only says which are not formatted.
set -euo pipefail
cd "$(dirname "${BASH_SOURCE[0]}")/.."
mode=(-i)
[ "${1:-}" = --check ] && mode=(--dry-run --Werror)
find platform Zembra zbd tools samples tests fuzz bench \( -name '*.h' -o -name '*.cpp' \) -print0 |
    xargs -0 clang-format-19 "${mode[@]}"
