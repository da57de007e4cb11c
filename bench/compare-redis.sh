#!/usr/bin/env bash
# Configuration reads and durable writes of cvdbserver against Redis GET and
# SET (appendfsync always), and 1 MiB data files against the disk's own
# sequential rate, all in one run on the same machine and disk.
#
#   bench/compare-redis.sh [build-dir]      (default: build)
#
# Needs redis-server and redis-benchmark, and the build's cvdbserver and
# load_gen (configure with -DCVDB_BUILD_BENCH=ON). SECONDS_PER_RUN (default
# 5) sets the length of each cvdbserver run. Everything lives in a temporary
# folder on the disk of TMPDIR, removed at the end.
set -euo pipefail

build=${1:-build}
seconds=${SECONDS_PER_RUN:-5}
server_bin=$build/src/service/cvdbserver
load_gen=$build/bench/load_gen
for tool in "$server_bin" "$load_gen"; do
  [[ -x $tool ]] || { echo "compare-redis: $tool is missing (build with -DCVDB_BUILD_BENCH=ON)" >&2; exit 2; }
done
for tool in redis-server redis-benchmark redis-cli; do
  command -v "$tool" >/dev/null || { echo "compare-redis: $tool is not installed" >&2; exit 2; }
done

work=$(mktemp -d)
server_pid=
redis_pid=
cleanup() {
  [[ -n $server_pid ]] && kill "$server_pid" 2>/dev/null && wait "$server_pid" 2>/dev/null
  [[ -n $redis_pid ]] && kill "$redis_pid" 2>/dev/null && wait "$redis_pid" 2>/dev/null
  rm -rf "$work"
}
trap cleanup EXIT

# cvdbserver on a free port, its databases in the temporary folder.
mkdir -p "$work/home/db" "$work/log"
echo '{"ServerPort": 0, "ForceIP4": true}' >"$work/home/db/config.json"
"$server_bin" --home "$work/home" --log-dir "$work/log" --console >"$work/server.out" 2>&1 &
server_pid=$!
for _ in $(seq 200); do
  port=$(sed -n 's/.*Listening on port \([0-9]*\).*/\1/p' "$work/server.out" | head -1)
  [[ -n $port ]] && break
  sleep 0.05
done
[[ -n ${port:-} ]] || { echo "compare-redis: cvdbserver did not start" >&2; cat "$work/server.out" >&2; exit 1; }

# Redis with every write synced before it is answered.
redis_port=$((port + 1))
mkdir -p "$work/redis"
redis-server --port "$redis_port" --bind 127.0.0.1 --dir "$work/redis" --save '' --appendonly yes \
  --appendfsync always --daemonize no >"$work/redis.out" 2>&1 &
redis_pid=$!
for _ in $(seq 200); do
  redis-cli -p "$redis_port" ping >/dev/null 2>&1 && break
  sleep 0.05
done
redis-cli -p "$redis_port" set key:000000000000 "$(head -c 100 /dev/zero | tr '\0' x)" >/dev/null

# One field of load_gen's JSON line.
field() { sed -n "s/.*\"$2\":\([0-9.]*\).*/\1/p" <<<"$1"; }
# load_gen: ops/s and p99 in microseconds.
ours() { "$load_gen" --port "$port" --seconds "$seconds" --json "$@"; }
# redis-benchmark --csv: "test","rps","avg","min","p50","p95","p99","max" (ms).
theirs() {
  redis-benchmark -p "$redis_port" --csv "$@" | tail -1 | tr -d '"' |
    awk -F, '{ printf "%.1f %.1f\n", $2, $7 * 1000 }'
}

printf '%-44s %12s %10s %12s %10s %7s\n' "workload" "ops/s" "p99 us" "Redis ops/s" "p99 us" "ratio"
row() {  # name ours-json redis-ops redis-p99
  local ops p99
  ops=$(field "$2" ops_per_sec)
  p99=$(field "$2" p99_us)
  printf '%-44s %12.0f %10.0f %12.0f %10.0f %7.2f\n' "$1" "$ops" "$p99" "$3" "$4" "$(awk "BEGIN { print $ops / $3 }")"
}

for c in 1 50; do
  r=$(ours --command getcfg --size 100 --connections "$c")
  read -r rops rp99 < <(theirs -t get -d 100 -c "$c" -n $((c == 1 ? 50000 : 300000)))
  row "100 B config read, $c conn, 1 db" "$r" "$rops" "$rp99"
done

r=$(ours --command setcfg --size 100 --connections 1)
read -r rops1 rp991 < <(theirs -t set -d 100 -c 1 -n 3000)
row "100 B durable write, 1 conn, 1 db" "$r" "$rops1" "$rp991"
r=$(ours --command setcfg --size 100 --connections 50 --databases 16)
read -r rops rp99 < <(theirs -t set -d 100 -c 50 -n 30000)
row "100 B durable write, 50 conn, 16 db" "$r" "$rops" "$rp99"
printf '%-44s %12.0f ops/s; against Redis with 1 connection: %.2f\n' "  (target: at least Redis with 1 conn)" \
  "$(field "$r" ops_per_sec)" "$(awk "BEGIN { print $(field "$r" ops_per_sec) / $rops1 }")"

# The disk's sequential rate with a sync at the end, in MiB/s.
dd_out=$(dd if=/dev/zero of="$work/dd.bin" bs=1M count=256 conv=fdatasync 2>&1 | tail -1)
disk=$(awk -v line="$dd_out" 'BEGIN {
  n = split(line, f, ",");
  split(f[n - 1], t, " ");   # "1.23 s"
  printf "%.1f", 256 / t[1] }')
rm -f "$work/dd.bin"
for cmd in setdata getdata; do
  r=$(ours --command "$cmd" --size 1048576 --connections 1)
  ops=$(field "$r" ops_per_sec)
  what=$([[ $cmd == setdata ]] && echo write || echo read)
  printf '%-44s %12.0f %10.0f %9.1f MiB/s against dd %.1f MiB/s: %.2f\n' "1 MiB data file $what, 1 conn" \
    "$ops" "$(field "$r" p99_us)" "$ops" "$disk" "$(awk "BEGIN { print $ops / $disk }")"
done
