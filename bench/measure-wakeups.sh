#!/usr/bin/env bash
# Wake-ups per event in zerithd under the end-to-end pipeline benchmark:
# futex calls per event (strace attached to every thread of the daemon for
# its whole life) and voluntary context switches per event (the benchmark's
# own /proc sample around the load, in a run without strace, which slows the
# process and changes what waits).
#
#   bench/measure-wakeups.sh [build-dir] [repeats]     (default build/release, 1)
#
# ZERITHD_BINARY=<path> measures another zerithd with the same benchmark
# (the benchmark starts whatever it names), e.g. a build of an older tree.
#
# Loads: 8 clients unpaced, 60,000 events, a reply each; the same one-way
# (--replies none); 8 clients paced at 1,000 events/s, 10,000 events, with
# and without replies. The futex count covers the daemon's start, its
# sessions' configuration and its stop as well (a few hundred calls).
set -euo pipefail
build="${1:-build/release}"
repeats="${2:-1}"
bench="$build/bench/e2e_pipeline_bench"
daemon="$(readlink -f "${ZERITHD_BINARY:-$build/daemon/zerithd}")"
[ -x "$bench" ] && [ -x "$daemon" ] || { echo "build $build first (e2e_pipeline_bench, zerithd)" >&2; exit 1; }
work="$(mktemp -d)"
trap 'rm -rf "$work"' EXIT

# The pid of the zerithd this build made, once it runs (other zerithd
# processes on the machine are not ours).
daemon_pid() {
  for _ in $(seq 1 600); do
    for pid in $(pgrep -x zerithd || true); do
      if [ "$(readlink -f "/proc/$pid/exe" 2>/dev/null)" = "$daemon" ]; then
        echo "$pid"
        return 0
      fi
    done
    sleep 0.05
  done
  return 1
}

# Prints "<records> <wake-ups/event> <CPU µs/event> <delivered/s>" of the
# zerithd row of one benchmark run (its output in $1).
row() {
  awk -F'|' '$2 ~ /^ zerithd / { gsub(/ /, ""); print $14, $8, $5, $4 }' "$1"
}

measure() {
  local name="$1"
  shift
  local out="$work/out" trace="$work/trace"
  # Without strace: the benchmark's own figures.
  "$bench" --pipelines zerithd --memory-sample 0 "$@" >"$out"
  grep -q "zerithd: lossless" "$out" || { echo "$name: not lossless" >&2; cat "$out" >&2; exit 1; }
  read -r records wakeups cpu delivered < <(row "$out")
  # With strace on every thread of the daemon.
  "$bench" --pipelines zerithd --memory-sample 0 "$@" >"$out" &
  local benchPid=$!
  local pid
  pid="$(daemon_pid)"
  strace -f -c -e trace=futex -o "$trace" -p "$pid" 2>/dev/null &
  local stracePid=$!
  wait "$benchPid"
  wait "$stracePid" || true
  local futex
  futex="$(awk '$NF == "futex" { print $4 }' "$trace")"
  read -r srecords _ < <(row "$out")
  printf '| %s | %s | %s | %.2f | %s | %s | %s |\n' "$name" "$(cut -d' ' -f1 /proc/loadavg)" "$records" \
    "$(echo "${futex:-0} / ${srecords:-1}" | bc -l)" "$wakeups" "$cpu" "$delivered"
}

echo "| load | load avg | events | futex calls/event (strace) | wake-ups/event | CPU µs/event | delivered/s |"
echo "|---|---|---|---|---|---|---|"
for _ in $(seq 1 "$repeats"); do
  measure "8 clients, unpaced, replies" --clients 8 --events 60000
  measure "8 clients, unpaced, one-way" --clients 8 --events 60000 --replies none
  measure "8 clients, 1,000/s, replies" --clients 8 --events 10000 --rate 1000
  measure "8 clients, 1,000/s, one-way" --clients 8 --events 10000 --rate 1000 --replies none
done
