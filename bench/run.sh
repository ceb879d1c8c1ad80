#!/usr/bin/env bash
# Runs the benchmarks of a build: bench/run.sh BUILD-DIRECTORY [ROUNDS [SECONDS]]
set -euo pipefail

build=$(cd "${1:?usage: bench/run.sh BUILD-DIRECTORY [ROUNDS [SECONDS]]}" && pwd)
shift
exec "$build/bench/FindBench" "$build/bin/zbd" "$@"
