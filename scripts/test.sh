#!/usr/bin/env bash
# Builds everything and runs every test: scripts/test.sh [PRESET], release unless another is named.
set -euo pipefail
cd "$(dirname "$0")/.."
. scripts/prerequisites.sh
need g++ cmake ninja-build libgtest-dev libgmock-dev libbenchmark-dev libsqlite3-dev mandoc jq nlohmann-json3-dev

preset=${1:-release}
cmake --preset "$preset" >/dev/null
cmake --build --preset "$preset"
ctest --preset "$preset"
