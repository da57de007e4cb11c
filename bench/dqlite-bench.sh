#!/usr/bin/env bash
# What a replicated write costs: 100-byte configuration parts upserted into a
# three-node dqlite cluster on the loopback, against the same upserts on a
# local SQLite file in WAL mode with synchronous=FULL (the engine's
# settings), all in one run on the same machine and disk. docs/scaling.md
# has the figures.
#
#   bench/dqlite-bench.sh
#
# Settings (environment):
#   RUNS=3             runs of every measurement; the table shows medians
#   SECONDS_PER_RUN=5  length of each run
#   CONNECTIONS=16     connections of the concurrent rows
#   NODES=3            nodes of the cluster (1 gives the single-node figure)
#
# Installs libdqlite-dev (and pkg-config and g++) from Debian when they are
# missing, and compiles bench/dqlite/dqlite_bench.cpp on its own: the project's
# build does not need dqlite. Every node, every database and the program live
# in a temporary folder on the disk of TMPDIR (refused if that is a tmpfs: the
# syncs must reach the disk), removed at the end; no node outlives the script.
set -euo pipefail

runs=${RUNS:-3}
seconds=${SECONDS_PER_RUN:-5}
connections=${CONNECTIONS:-16}
nodes=${NODES:-3}
here=$(cd "$(dirname "$0")" && pwd)

if ! pkg-config --exists dqlite 2>/dev/null || ! command -v c++ >/dev/null; then
  echo "dqlite-bench: installing libdqlite-dev, pkg-config and g++" >&2
  apt-get update -q >/dev/null
  apt-get install -y -q libdqlite-dev libsqlite3-dev pkg-config g++ >/dev/null
fi

work=$(mktemp -d)
if [[ $(stat -f -c %T "$work") == tmpfs ]]; then
  rmdir "$work"
  echo "dqlite-bench: the temporary folder is on a tmpfs; set TMPDIR to a folder on a disk" >&2
  exit 2
fi
node_pids=()
cleanup() {
  local pid
  for pid in "${node_pids[@]}"; do kill "$pid" 2>/dev/null || true; done
  for pid in "${node_pids[@]}"; do wait "$pid" 2>/dev/null || true; done
  rm -rf "$work"
}
trap cleanup EXIT
trap 'exit 130' INT TERM

bench=$work/dqlite_bench
# shellcheck disable=SC2046  # pkg-config's flags are words
nice -n 10 c++ -std=c++20 -O2 -o "$bench" "$here/dqlite/dqlite_bench.cpp" $(pkg-config --cflags --libs dqlite sqlite3) \
  -pthread

# One sync of the disk: 4 KiB written with O_DSYNC, 200 times; prints ms.
disk_sync_ms() {
  dd if=/dev/zero of="$work/dd.bin" bs=4k count=200 oflag=dsync 2>&1 | tail -1 |
    awk '{ n = split($0, f, ","); split(f[n - 1], t, " "); printf "%.2f", t[1] * 1000 / 200 }'
  rm -f "$work/dd.bin"
}

echo "dqlite-bench: $(nproc) cores, dqlite $(pkg-config --modversion dqlite), SQLite $(pkg-config --modversion sqlite3);" \
  "$runs run(s) of ${seconds} s; folder on $(df --output=source "$work" | tail -1) ($(stat -f -c %T "$work"))"
echo "dqlite-bench: load average at start: $(cut -d' ' -f1-3 /proc/loadavg); one 4 KiB O_DSYNC write: $(disk_sync_ms) ms"

# The cluster: node 1 bootstraps it, the others join through the leader.
read -r -a ports <<<"$("$bench" free-ports "$nodes")"
addresses=()
for ((i = 1; i <= nodes; i++)); do
  address=127.0.0.1:${ports[i - 1]}
  addresses+=("$address")
  mkdir -p "$work/node$i" "$work/local"
  "$bench" node "$i" "$address" "$work/node$i" >"$work/node$i.out" 2>&1 &
  node_pids+=($!)
done
for ((i = 1; i <= nodes; i++)); do
  for _ in $(seq 100); do
    grep -q ready "$work/node$i.out" && break
    sleep 0.05
  done
  grep -q ready "$work/node$i.out" || { echo "dqlite-bench: node $i did not start:" >&2; cat "$work/node$i.out" >&2; exit 1; }
done
"$bench" form "${addresses[@]}" | sed 's/^/dqlite-bench: /' || {
  echo "dqlite-bench: the cluster did not form" >&2
  exit 1
}
# The writes go through the last node, which finds the leader for them.
entry=${addresses[nodes - 1]}

# ---------------------------------------------------------------- measuring
# Every measurement prints "writes/s p50-us p99-us busy-retries cpu-us":
# the last is the processor time per write of the writing process and, on
# dqlite, of the nodes.

field() { sed -n "s/.*\"$2\":\([0-9.]*\).*/\1/p" <<<"$1"; }
tick_us=$((1000000 / $(getconf CLK_TCK)))
nodes_cpu_us() {  # user and system time of every node so far
  local pid total=0
  for pid in "${node_pids[@]}"; do
    total=$((total + $(awk '{ print $14 + $15 }' "/proc/$pid/stat")))
  done
  echo $((total * tick_us))
}

measure() {  # local|dqlite, a name for the run's databases, then dqlite_bench write options
  local side=$1 name=$2 out nodes_before nodes_after
  shift 2
  local where=$entry
  [[ $side == local ]] && where=$work/local
  nodes_before=$(nodes_cpu_us)
  out=$("$bench" write "$side" "$where" --seconds "$seconds" --name "$name" "$@") || {
    echo "dqlite-bench: the $side run ($*) failed: $out" >&2
    exit 1
  }
  nodes_after=$(nodes_cpu_us)
  [[ $side == local ]] && nodes_after=$nodes_before
  echo "$(field "$out" writes_per_sec) $(field "$out" p50_us) $(field "$out" p99_us) $(field "$out" busy_retries)" \
    "$(awk -v c="$(field "$out" cpu_us)" -v n=$((nodes_after - nodes_before)) -v w="$(field "$out" writes)" \
      'BEGIN { printf "%.0f", (c + n) / w }')"
}

median() { sort -g | awk '{ v[NR] = $1 } END { if (NR == 0) print 0; else print v[int((NR + 1) / 2)] }'; }

printf '\n%-36s %9s %8s %8s %7s %9s %8s %8s %7s %6s %7s\n' "100 B upsert" "local w/s" "p50 us" "p99 us" \
  "cpu/w" "dqlite/s" "p50 us" "p99 us" "cpu/w" "ratio" "busy"
# Runs both sides RUNS times, alternating, each run on new databases, and
# prints one table row of medians.
row_no=0
row() {  # name, then dqlite_bench write options for both sides
  local name=$1 i a b c d e out
  shift
  row_no=$((row_no + 1))
  local -a lo=() l5=() l9=() lc=() qo=() q5=() q9=() qb=() qc=()
  for ((i = 0; i < runs; i++)); do
    out=$(measure local "row$row_no-run$i" "$@") || exit 1
    read -r a b c d e <<<"$out"
    lo+=("$a"); l5+=("$b"); l9+=("$c"); lc+=("$e")
    out=$(measure dqlite "row$row_no-run$i" "$@") || exit 1
    read -r a b c d e <<<"$out"
    qo+=("$a"); q5+=("$b"); q9+=("$c"); qb+=("$d"); qc+=("$e")
  done
  local m=() v
  for v in lo l5 l9 lc qo q5 q9 qc qb; do
    m+=("$(eval "printf '%s\\n' \"\${${v}[@]}\"" | median)")
  done
  printf '%-36s %9.0f %8.0f %8.0f %7.0f %9.0f %8.0f %8.0f %7.0f %6s %7.0f\n' "$name" "${m[@]:0:8}" \
    "$(awk -v a="${m[4]}" -v b="${m[0]}" 'BEGIN { printf "%.2f", (b > 0 ? a / b : 0) }')" "${m[8]}"
}

row "1 conn" --connections 1
row "$connections conn, 1 database" --connections "$connections"
row "$connections conn over $connections databases" --connections "$connections" --databases "$connections"
row "$connections conn, 1 database, no gate" --connections "$connections" --no-gate

echo
echo "dqlite-bench: cpu/w = processor time per write in us (the writing process, and on dqlite all nodes);" \
  "ratio = dqlite writes/s over local; busy = refusals as busy that were sent again"
"$bench" members "$entry" | sed 's/^/dqlite-bench: at the end, /'
echo "dqlite-bench: load average at end: $(cut -d' ' -f1-3 /proc/loadavg); one 4 KiB O_DSYNC write: $(disk_sync_ms) ms"
