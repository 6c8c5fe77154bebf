#!/usr/bin/env bash
# Builds, creates the default device root if it does not exist, runs the
# daily job for yesterday on it and prints the aggregated log it wrote.
set -euo pipefail
cd "$(dirname "$0")/.."
bash scripts/deps.sh
cmake -S . -B build -G Ninja
cmake --build build
export TALLYRUN_ROOT="${TALLYRUN_ROOT:-$PWD/build/default-root}"
if [ ! -d "$TALLYRUN_ROOT" ]; then
  build/src/tools/devsim init "$TALLYRUN_ROOT" >/dev/null
fi
submissions="$TALLYRUN_ROOT/var/diagvault/submissions"
before=$(ls "$submissions" 2>/dev/null | grep -c '^log-aggregated_.*\.193$' || true)
TALLYRUN_LOG_STDERR=1 build/src/driver/tallyrun -f
newest=$(ls -t "$submissions"/log-aggregated_*.193 2>/dev/null | head -n 1 || true)
after=$(ls "$submissions" 2>/dev/null | grep -c '^log-aggregated_.*\.193$' || true)
if [ -n "$newest" ] && [ "$after" -gt "$before" ]; then
  echo "aggregated log: $newest"
else
  echo "no aggregated log was written (nothing whitelisted for yesterday, or submission is off)"
fi
cat <<EOF

To use the tools on this root from your shell, paste:
  export TALLYRUN_ROOT="$TALLYRUN_ROOT"
  export PATH="$PWD/build/src/tools:$PWD/build/src/driver:\$PATH"
EOF
