#!/usr/bin/env bash
# A bystander's read latency while two connections each write a 150 MiB
# configuration part to a database of their own (bench/big_cfg_bench.cpp).
# Every run starts a fresh server on an empty root; the script prints each
# run and the medians of the bystander's p50, p99 and maximum.
#
#   bench/big-cfg-bench.sh [build-dir]      (default: build)
#
# Settings (environment): RUNS=3, WRITERS=2, MIB=150, SERVER=<a cvdbserver
# binary> (default: the build's; another one compares two builds with the
# same client). Everything lives in a temporary folder on the disk of
# TMPDIR, removed at the end; the server does not outlive the script.
set -euo pipefail

build=${1:-build}
runs=${RUNS:-3}
writers=${WRITERS:-2}
mib=${MIB:-150}
server_bin=${SERVER:-$build/src/service/cvdbserver}
bench=$build/bench/big_cfg_bench
cvdb=$build/client/cvdb
for tool in "$server_bin" "$bench" "$cvdb"; do
  [[ -x $tool ]] || { echo "big-cfg-bench: $tool is missing" >&2; exit 2; }
done

work=$(mktemp -d "${TMPDIR:-/tmp}/big-cfg-bench.XXXXXX")
server_pid=
stop_server() {
  if [[ -n $server_pid ]]; then
    kill "$server_pid" 2>/dev/null || true
    wait "$server_pid" 2>/dev/null || true
    server_pid=
  fi
}
cleanup() {
  stop_server
  rm -rf "$work"
}
trap cleanup EXIT

median() { sort -g | awk '{a[NR]=$1} END {print a[int((NR+1)/2)]}'; }

echo "server: $server_bin; $writers writers of $mib MiB; $runs runs"
: >"$work/results"
for run in $(seq "$runs"); do
  rm -rf "$work/home" "$work/log"
  mkdir -p "$work/home/db"
  port=$((40000 + RANDOM % 20000))
  printf '{"ServerPort": %d}\n' "$port" >"$work/home/db/config.json"
  "$server_bin" --home "$work/home" --log-dir "$work/log" >"$work/server.out" 2>&1 &
  server_pid=$!
  for _ in $(seq 100); do "$cvdb" --port "$port" ping >/dev/null 2>&1 && break; sleep 0.1; done
  line=$("$bench" --port "$port" --writers "$writers" --mib "$mib")
  echo "run $run: $line"
  # p50, p99, max
  awk '{print $3, $6, $9}' <<<"$line" >>"$work/results"
  stop_server
done
printf 'median of %d runs: bystander p50 %s ms, p99 %s ms, max %s ms\n' "$runs" \
  "$(cut -d' ' -f1 "$work/results" | median)" "$(cut -d' ' -f2 "$work/results" | median)" \
  "$(cut -d' ' -f3 "$work/results" | median)"
