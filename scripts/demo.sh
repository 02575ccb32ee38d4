#!/usr/bin/env bash
# Builds the product and shows what it is for: plans made from sample histories.
set -euo pipefail
cd "$(dirname "$0")/.."
. scripts/prerequisites.sh
need g++ cmake ninja-build

echo "Building the product in build/demo ..."
cmake --preset release -B build/demo -DZQ3_TESTS=OFF -DZQ3_BENCH=OFF >/dev/null
# One line that counts on a terminal; elsewhere a line in ten.
if [ -t 1 ]; then
  cmake --build build/demo
else
  cmake --build build/demo | awk '!/^\[[0-9]+\// || $1 ~ /^.[0-9]*0\// { print; fflush() }'
fi

scratch=$(mktemp -d)
trap 'rm -rf "$scratch"' EXIT
export ZQ3DBPATH=$scratch ZQ3DIAGLOG=$scratch/diag.log ZQ3SYNC=off
PATH=$PWD/build/demo/tool:$PWD/build/demo/admin:$PATH

title() { printf '\n### %s\n' "$*"; }
show() {
  printf '\n$ %s\n' "$*" | sed "s|$scratch|\$ZQ3DBPATH|g"
  "$@" 2>&1
}

# One history directory for each database, named by its alias in upper case.
mkdir "$scratch/WEEK" "$scratch/BROKEN"

title "A week of backups"
show zq3hist load "$scratch/WEEK" examples/week.zq3
title "Which images does Saturday's delta image need, to restore the whole database?"
show zq3ckrst -d week -t 20250111010000
title "And to restore the tablespace ORDERS alone?"
show zq3ckrst -d week -t 20250111010000 -r tablespace -n orders
title "A chain with a hole is refused before anybody restores the first half of it"
show zq3hist load "$scratch/BROKEN" examples/broken.zq3
show zq3ckrst -d broken -t 20250508010000 || echo "exit status $?"
