#!/usr/bin/env bash
# Runs the end-to-end pipeline benchmark whole: zerithd beside the peer log
# pipeline (syslog-ng), same collector, same events, in one go per load.
#
#   bench/run-e2e.sh [build-dir]        (default build/release)
#
# Loads: 1 and 8 clients as fast as taken; 8 clients paced at 100 and 1,000
# events/s; 8 clients unpaced and at 1,000 events/s again with one-way events
# (--replies none); one run of 1,000,000 events with a memory sample after 10,000;
# the idle processes with ten open sessions for a minute; zerithd with the
# spool on and the collector down for 1,000,000 events, then up (backlog
# spooled and drained). Every run checks
# that each event arrived exactly once and prints "NOT lossless" otherwise.
# Last, the library floor: libplist, nlohmann, zlib and libcurl alone on one
# event's share of the work (ipc_bench, https_bench).
# Set QUICK=1 for shorter runs (a tenth of the events, 10 s idle).
set -euo pipefail
build="${1:-build/release}"
bench="$build/bench/e2e_pipeline_bench"
ninja -C "$build" e2e_pipeline_bench zerithd ipc_bench https_bench >/dev/null
scale=1
idle=60
if [ "${QUICK:-0}" = 1 ]; then scale=10; idle=10; fi

run() {
  echo
  echo "## $*"
  "$bench" "$@"
}

echo "# e2e pipeline benchmark, $(date -u '+%Y-%m-%d %H:%M UTC'), load average: $(cut -d' ' -f1-3 /proc/loadavg)"
run --clients 1 --events $((200000 / scale))
run --clients 8 --events $((200000 / scale))
run --clients 8 --events $((3000 / scale)) --rate 100 --memory-sample 0
run --clients 8 --events $((30000 / scale)) --rate 1000 --memory-sample 0
# The same two loads with one-way events: no reply per event, one flush per
# client at the end (the framework's backpressure paces the senders).
run --clients 8 --events $((200000 / scale)) --replies none
run --clients 8 --events $((30000 / scale)) --rate 1000 --memory-sample 0 --replies none
run --clients 8 --events $((1000000 / scale)) --memory-sample 10000
run --clients 1 --events 1000 --memory-sample 0 --idle-seconds "$idle" --idle-sessions 10
# The spool: a backlog of 1,000,000 events built while the collector is down,
# then drained, beside a normal zerithd run of the same load.
run --pipelines zerithd --clients 8 --events $((1000000 / scale)) --memory-sample 0 --spool-outage
# The library floor of one event in the same run: what libplist, nlohmann,
# zlib and libcurl take on their own for the work the design gives them
# (medians of three, CPU time per event).
echo
echo "## the library floor of one event"
floor=(--benchmark_repetitions=3 --benchmark_report_aggregates_only=true)
"$build/bench/ipc_bench" --benchmark_filter='OfAnEvent|EmptyReply' "${floor[@]}" 2>/dev/null | grep _median
"$build/bench/https_bench" --benchmark_filter='ReferenceNlohmannRecord|ReferenceZlib|ReferenceCurl' "${floor[@]}" 2>/dev/null |
  grep _median
echo
echo "load average after: $(cut -d' ' -f1-3 /proc/loadavg)"
