#!/usr/bin/env bash
# clang-tidy over every source of the product (tests are compiled with the same warnings, but not tidied).
# usage: tidy.sh BUILD JOBS
set -euo pipefail
cd "$(dirname "${BASH_SOURCE[0]}")/.."
find platform Zembra zbd tools samples -name '*.cpp' -print0 |
    xargs -0 -n 1 -P "$2" clang-tidy-19 -p "$1" --quiet --warnings-as-errors='*'
