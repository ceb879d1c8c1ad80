#!/usr/bin/env bash
# Runs each fuzzer on its saved inputs and onwards. usage: fuzz.sh DIRECTORY SECONDS
set -euo pipefail
project=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
for fuzzer in "$1"/*Fuzzer; do
    name=$(basename "$fuzzer" Fuzzer)
    echo "== $name"
    work=$(mktemp -d)
    "$fuzzer" -max_total_time="$2" -timeout=10 -rss_limit_mb=2048 -artifact_prefix="$work/" "$work" \
        "$project/fuzz/corpus/${name,,}" || { echo "kept in $work"; exit 1; }
    rm -rf "$work"
done
