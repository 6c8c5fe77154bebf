#!/usr/bin/env bash
# Builds and runs the main job on the default device root (build/default-root).
set -euo pipefail
cd "$(dirname "$0")/.."
bash scripts/deps.sh
cmake -S . -B build -G Ninja
cmake --build build
export TALLYRUN_ROOT="${TALLYRUN_ROOT:-$PWD/build/default-root}"
tb=build/src/tools/tallybook
# Until the daily job lands, exercise the store the job reads: record a
# counter and two samples for today and print what the store holds.
"$tb" add com.velmora.example.launches 1
"$tb" push com.velmora.example.latency 12.5
"$tb" push com.velmora.example.latency 7.25
echo "store of $TALLYRUN_ROOT, today is day $("$tb" today):"
"$tb" dump
