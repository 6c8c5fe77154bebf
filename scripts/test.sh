#!/usr/bin/env bash
# Builds everything (warnings are errors) and runs every test; then the same
# tests once more under the address and undefined-behaviour sanitizers.
set -euo pipefail
cd "$(dirname "$0")/.."
bash scripts/deps.sh
cmake -S . -B build -G Ninja -DTALLYRUN_WERROR=ON
cmake --build build
ctest --test-dir build --output-on-failure -j2
cmake -S . -B build-asan -G Ninja -DTALLYRUN_WERROR=ON -DTALLYRUN_SANITIZE=ON -DTALLYRUN_BENCH=OFF \
  -DCMAKE_BUILD_TYPE=Debug
cmake --build build-asan
ctest --test-dir build-asan --output-on-failure -j2
