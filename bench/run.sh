#!/usr/bin/env bash
# Runs the benchmarks of a build: bench/run.sh BUILD-DIRECTORY [ROUNDS [SECONDS]]
set -euo pipefail

build=$(cd "${1:?usage: bench/run.sh BUILD-DIRECTORY [ROUNDS [SECONDS]]}" && pwd)
shift
for name in Find Discovery Activation; do
    printf "\n### %s\n\n" "$name"
    "$build/bench/${name}Bench" "$build/bin/zbd" "$@"
done
