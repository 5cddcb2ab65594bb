#!/bin/bash
# Times `heft -a` on a machine busy with a fleet of processes against the
# plain cost of reading every process's smaps once, on the same fleet in the
# same run, and reports heft's peak resident memory.
#
#   bench/fleet.sh [HEFT] [COUNT]
#
# HEFT is the heft binary to time (default build/heft; use a Release build),
# COUNT the number of processes in the fleet (default 300). Needs root, since
# `heft -a` does. The fleet (bench/fleet_child.c) mixes private anonymous
# memory, a shared-memory segment mapped by all, pages shared copy-on-write
# after fork, shared and private file mappings, and pages pushed out to swap
# when swap is on. Every process the script starts is killed when it exits.

set -euo pipefail

here=$(cd "$(dirname "$0")" && pwd)
heft=${1:-build/heft}
count=${2:-300}
runs=5

if [[ ! -x $heft ]]; then
    echo "fleet.sh: no heft binary at $heft" >&2
    exit 1
fi
if [[ $(id -u) -ne 0 ]]; then
    echo "fleet.sh: heft -a needs root" >&2
    exit 1
fi

work=$(mktemp -d /tmp/heft-fleet-XXXXXX)
leader=""

cleanup() {
    local pids=()
    if [[ -s $work/pids ]]; then
        mapfile -t pids < "$work/pids"
    elif [[ -n $leader ]]; then
        pids=("$leader")
    fi
    # The leader first: every member dies with its parent anyway, the
    # explicit kills only make it immediate.
    if ((${#pids[@]} > 0)); then
        kill -KILL "${pids[@]}" 2>/dev/null || true
    fi
    if [[ -n $leader ]]; then
        wait "$leader" 2>/dev/null || true
    fi
    rm -rf "$work"
}
trap cleanup EXIT
trap 'exit 130' INT TERM

cc -O2 -Wall -o "$work/fleet_child" "$here/fleet_child.c"

swap=0
if (($(wc -l < /proc/swaps) > 1)); then swap=1; fi

"$work/fleet_child" "$count" "$work" "$swap" &
leader=$!
for ((waited = 0; waited < 600; ++waited)); do
    [[ -e $work/ready ]] && break
    if ! kill -0 "$leader" 2>/dev/null; then
        echo "fleet.sh: the fleet failed to start" >&2
        exit 1
    fi
    sleep 0.1
done
if [[ ! -e $work/ready ]]; then
    echo "fleet.sh: the fleet did not lay out its memory within 60 s" >&2
    exit 1
fi
fleet=$(wc -l < "$work/pids")
# Processes may come and go while they are counted.
all=$({ ls -d /proc/[0-9]* 2> /dev/null || true; } | wc -l)
echo "fleet: $fleet processes ($all on the machine), swap $([[ $swap == 1 ]] && echo on || echo off)"

# Best of $runs wall-clock times of a command, in nanoseconds.
best_of() {
    local best=0 start end elapsed
    for ((run = 0; run < runs; ++run)); do
        start=$(date +%s%N)
        "$@" > /dev/null 2>&1 || true
        end=$(date +%s%N)
        elapsed=$((end - start))
        if ((best == 0 || elapsed < best)); then best=$elapsed; fi
    done
    echo "$best"
}

read_smaps() { cat /proc/[0-9]*/smaps > /dev/null 2>&1; }

smaps_ns=$(best_of read_smaps)
# A run that cannot finish in ten minutes is cut short rather than hang.
heft_ns=$(best_of timeout 600 "$heft" -a)
peak_kib=$(/usr/bin/time -f %M "$heft" -a 2>&1 > /dev/null | tail -n 1)

# The same run saving every process as a snapfile, each time into a new
# directory; then the snapfiles of the last one read back.
save_all() {
    local saved
    saved=$(mktemp -d "$work/snaps.XXXXXX")
    echo "$saved" > "$work/last-snaps"
    timeout 600 "$heft" -a --snapshot-dir "$saved"
}
read_saved() { "$heft" "$(cat "$work/last-snaps")"/*.heftsnap; }
save_ns=$(best_of save_all)
read_ns=$(best_of read_saved)
saved=$(cat "$work/last-snaps")
snap_bytes=$(du -sb "$saved" | cut -f1)

# The summary of the user processes (the kernel, pid 0, left out) against
# the kernel's own count of what they cost together: the sum over them of
# Pss_Dirty + SwapPss + VmPTE (each shared page divided among its mappers
# adds up to the page once).
summary=$({ "$heft" -a -x 0 -f bytes 2> /dev/null || true; } | sed -n 's/^Summary Heft: \([0-9]*\) B.*/\1/p')
# Processes heft may not read (pid 1 in some containers) are left out of both.
kernel=$({ cat /proc/[0-9]*/smaps_rollup /proc/[0-9]*/status 2> /dev/null || true; } |
    awk '$1 == "Pss_Dirty:" || $1 == "SwapPss:" || $1 == "VmPTE:" { total += $2 } END { printf "%.0f", total * 1024 }')

ms() { printf '%d.%03d ms' $(($1 / 1000000)) $((($1 / 1000) % 1000)); }
echo "cat /proc/*/smaps: $(ms "$smaps_ns") (best of $runs)"
echo "heft -a:           $(ms "$heft_ns") (best of $runs)"
echo "ratio:             $(awk -v h="$heft_ns" -v s="$smaps_ns" 'BEGIN { printf "%.2f", h / s }')"
echo "heft peak RSS:     $peak_kib KiB"
echo "heft -a, saving:   $(ms "$save_ns") (best of $runs; $(ls "$saved" | wc -l) snapfiles, $snap_bytes bytes)"
echo "heft snapfiles:    $(ms "$read_ns") (best of $runs)"
echo "summary:           $summary B; kernel (Pss_Dirty + SwapPss + VmPTE): $kernel B"
echo "summary/kernel:    $(awk -v h="$summary" -v k="$kernel" 'BEGIN { printf "%.4f", h / k }')"
