#!/usr/bin/env bash
# The one script that people, hooks and CI run before a change lands.
set -euo pipefail
cd "$(dirname "${BASH_SOURCE[0]}")/.."
jobs=${JOBS:-$(nproc)}

step() { printf '\n== %s\n' "$*"; }

step format
tools/format.sh --check

step "build and test (release, warnings as errors)"
cmake --preset release >/dev/null
cmake --build --preset release -j "$jobs"
ctest --preset release

step clang-tidy
tools/tidy.sh build/release "$jobs"

for sanitizer in asan tsan; do
    step "tests under $sanitizer"
    cmake --preset "$sanitizer" >/dev/null
    cmake --build --preset "$sanitizer" -j "$jobs"
    ctest --preset "$sanitizer"
done

step "the demonstration"
samples/demo.sh build/release
