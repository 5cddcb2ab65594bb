#!/bin/bash
# Runs `heft -a -j FILE` again and again while processes are started and
# killed all the time, and checks every run: heft succeeds, the report is
# whole, the JSON file parses, and no process's figures are cut short
# without a warning. Then it says what standard error held.
#
#   bench/churn.sh [HEFT] [RUNS]
#
# HEFT is the heft binary (default build/heft), RUNS the number of runs
# (default 100). Needs root, since `heft -a` does. The churn
# (bench/churn_child.c) starts 150 processes a second and kills as many;
# each writes a few MiB or maps hundreds of small mappings. Every process
# the script starts is killed and reaped when it exits. Timing-sensitive:
# not part of the test suite.

set -euo pipefail

here=$(cd "$(dirname "$0")" && pwd)
heft=${1:-build/heft}
runs=${2:-100}
rate=150
live=150

if [[ ! -x $heft ]]; then
    echo "churn.sh: no heft binary at $heft" >&2
    exit 1
fi
if [[ $(id -u) -ne 0 ]]; then
    echo "churn.sh: heft -a needs root" >&2
    exit 1
fi
if ! which python3 > /dev/null; then
    echo "churn.sh: python3 is needed to read the JSON reports" >&2
    exit 1
fi

work=$(mktemp -d /tmp/heft-churn-XXXXXX)
churn=""

cleanup() {
    # The churn kills and reaps its own processes on SIGTERM; each of them
    # also dies with it, should it have to be killed.
    if [[ -n $churn ]]; then
        kill -TERM "$churn" 2> /dev/null || true
        for ((waited = 0; waited < 50; ++waited)); do
            kill -0 "$churn" 2> /dev/null || break
            sleep 0.1
        done
        kill -KILL "$churn" 2> /dev/null || true
        wait "$churn" 2> /dev/null || true
    fi
    rm -rf "$work"
}
trap cleanup EXIT
trap 'exit 130' INT TERM

cc -O2 -Wall -o "$work/churn_child" "$here/churn_child.c"

# The kernel's figure for each process, keyed by pid and start time (pids
# come round again quickly under churn): Private_Dirty + Shared_Dirty + Swap
# + VmPTE, the bytes a process's heft counts, every page it maps in full.
# `check` judges one run from the snapshots taken just before and just after
# it. A process the report shows without a warning or an error, alive at
# both moments, whose kernel figure held still meanwhile (within 5% or
# 256 KiB), must have a heft within that much of it: heft read it at some
# moment in between, so a walk that stopped early shows as a heft below the
# kernel's. Processes that changed meanwhile, or were not there at both
# moments, cannot be judged so and are only counted.
judge='
import json, os, sys

def snapshot():
    figures = {}
    for pid in filter(str.isdigit, os.listdir("/proc")):
        try:
            with open(f"/proc/{pid}/stat") as f: start = f.read().rsplit(")", 1)[1].split()[19]
            with open(f"/proc/{pid}/smaps_rollup") as f: text = f.read()
            with open(f"/proc/{pid}/status") as f: text += f.read()
        except (OSError, IndexError):
            continue
        kb = {line.split(":")[0]: int(line.split()[1]) for line in text.splitlines() if line.endswith(" kB")}
        if "VmPTE" in kb and "Private_Dirty" in kb:
            bytes = 1024 * (kb["Private_Dirty"] + kb["Shared_Dirty"] + kb["Swap"] + kb["VmPTE"])
            figures[pid] = (start, bytes)
    return figures

def check(report, before, after, counts):
    with open(report) as f: text = f.read()
    summary = text.rfind("\nSummary Heft: ")
    if summary < 0 or not text.endswith("\n") or "TOTAL\n" not in text[summary:]:
        print("the report does not end with the summary")
    try:
        with open(report + ".json") as f: processes = json.load(f)["processes"]
    except (OSError, ValueError, KeyError) as error:
        print(f"the JSON report does not parse: {error}")
        return
    with open(before) as f: before = json.load(f)
    with open(after) as f: after = json.load(f)
    marked = judged = unjudged = 0
    for process in processes:
        pid, heft = str(process["pid"]), process.get("heft", 0)
        if process.get("warnings") or process.get("errors"):
            marked += 1
            continue
        if pid not in before or pid not in after or before[pid][0] != after[pid][0]:
            unjudged += 1
            continue
        low, high = sorted((before[pid][1], after[pid][1]))
        slack = max(high // 20, 256 * 1024)
        if high - low > slack:
            unjudged += 1
            continue
        judged += 1
        if not low - slack <= heft <= high + slack:
            name = process["name"]
            print(f"{name} [{pid}]: heft {heft} B without a warning; the kernel said {low} to {high} B")
    with open(counts, "a") as f: print(judged, marked, unjudged, file=f)

if sys.argv[1] == "snapshot":
    json.dump(snapshot(), sys.stdout)
else:
    check(*sys.argv[2:])
'

"$work/churn_child" "$rate" "$live" > /dev/null &
churn=$!
sleep 2

failures=0
for ((run = 1; run <= runs; ++run)); do
    out=$work/run$run
    python3 -c "$judge" snapshot > "$out.before"
    status=0
    timeout 600 "$heft" -a -j "$out.json" > "$out" 2> "$out.err" || status=$?
    python3 -c "$judge" snapshot > "$out.after"
    {
        if ((status != 0)); then echo "exit status $status"; fi
        python3 -c "$judge" check "$out" "$out.before" "$out.after" "$work/judged"
    } > "$out.faults"
    if [[ -s $out.faults ]]; then
        failures=$((failures + 1))
        echo "run $run failed:" >&2
        head -n 5 "$out.faults" | sed 's/^/    /' >&2
    fi
    wc -l < "$out.err" >> "$work/lines"
    cat "$out.err" >> "$work/stderr"
    rm -f "$out" "$out.json" "$out.before" "$out.after"
done

echo "runs: $runs, failed: $failures"
awk '{ judged += $1; marked += $2; unjudged += $3 }
     END { printf "processes judged against the kernel: %d, marked with a warning or error: %d, not judged: %d\n",
           judged, marked, unjudged }' "$work/judged"
awk '{ total += $1; if ($1 > max) max = $1 }
     END { printf "standard error: %.1f lines a run on average, %d at most\n", total / NR, max }' "$work/lines"
# Messages that differ only in their numbers and the processes they name
# ("name [pid]", or a list of them) are one kind.
kinds() { sed -E 's/[0-9]+/N/g; s/[^ ,]+ \[N\](, [^ ,]+ \[N\])*( and N more)?/P/g' "$work/stderr"; }
echo "standard error: $(sort -u "$work/stderr" | wc -l) distinct lines, $(kinds | sort -u | wc -l) kinds;" \
    "the most frequent:"
kinds | sort | uniq -c | sort -rn | head -n 8
