#!/usr/bin/env bash
# Runs a command with the wall clock moved to another moment, for every
# process it starts: scripts/moved-clock.sh '2028-02-29 12:00:00' CMD...
# The moment is read in the zone of TZ, as the clock would be.
#
# libfaketime, by an offset rather than through its `faketime` wrapper: the
# wrapper shares its start time through a shared-memory descriptor that lands
# on whatever number is free, which is where a socket-activated service looks
# for its socket. The monotonic clock stays real, as it does when a machine's
# calendar moves: timed waits compute their deadline from it.
set -euo pipefail
moment=$1
shift
lib=$(ls /usr/lib/*/faketime/libfaketime.so.1 2>/dev/null | head -n1)
[ -n "$lib" ] || { echo "moved-clock: libfaketime is not installed (apt-get install faketime)" >&2; exit 2; }
target=$(date -d "$moment" +%s)
offset=$((target - $(date +%s)))
echo "moved-clock: $(date -d "@$target" '+%Y-%m-%d %H:%M:%S %Z') (TZ=${TZ:-unset}), $offset s from now" >&2
export LD_PRELOAD="$lib${LD_PRELOAD:+:$LD_PRELOAD}" FAKETIME="$(printf '%+d' "$offset")" FAKETIME_DONT_FAKE_MONOTONIC=1
exec "$@"
