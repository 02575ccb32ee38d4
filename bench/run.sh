#!/bin/sh
# Runs the benchmarks of a build directory (default: build/release) and prints their tables of ratios
# as Markdown. What follows the directory goes to every program, for instance
#     bench/run.sh build/release --benchmark_repetitions=21
# The programs' full listings go to standard error.
# With BENCH_EARLIER=PATH, the zq3ckrst of another build, the whole command is measured against that
# one, too.
set -eu
root=$(cd "$(dirname "$0")/.." && pwd)
build=${1:-$root/build/release}
[ $# -eq 0 ] || shift
ran=0
for name in bench_reader bench_batch bench_plan; do
    program=$build/bench/$name
    if [ -x "$program" ]; then
        "$program" "$@"
        ran=1
    fi
done
if [ $ran -eq 0 ]; then
    echo "$build/bench: no benchmarks; build with Google Benchmark installed (libbenchmark-dev)" >&2
    exit 1
fi
