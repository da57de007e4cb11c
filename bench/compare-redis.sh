#!/usr/bin/env bash
# cvdbserver against Redis and the disk, all in one run on the same machine
# and disk: keep-alive, configuration reads and durable writes against
# redis-benchmark's PING, GET and SET; packs against HGETALL and
# MULTI/HSET+SET/EXEC; 1 MiB data files against dd. Redis syncs every
# write before it answers (appendfsync always), as cvdbserver does.
#
#   bench/compare-redis.sh [build-dir]      (default: build)
#
# Settings (environment):
#   RUNS=3             runs of every measurement; the table shows medians
#   SECONDS_PER_RUN=5  length of each run
#   ONLY="kv files packs"  groups to run
#   FOLDER_PACKS=10000 packs in the folder that the listing reads
#   SERVER_CONFIG=     more keys of cvdbserver's config.json, e.g.
#                      '"ReadCacheMiB": 0' to measure without the read cache
#
# Needs the build's cvdbserver and load_gen (-DCVDB_BUILD_BENCH=ON); installs
# redis-server and redis-tools from Debian when they are missing. Both
# servers and every file live in a temporary folder on the disk of TMPDIR,
# removed at the end; neither server outlives the script.
set -euo pipefail

build=${1:-build}
runs=${RUNS:-3}
seconds=${SECONDS_PER_RUN:-5}
only=${ONLY:-kv files packs}
folder_packs=${FOLDER_PACKS:-10000}
server_config=${SERVER_CONFIG:-}
server_bin=$build/src/service/cvdbserver
load_gen=$build/bench/load_gen
for tool in "$server_bin" "$load_gen"; do
  [[ -x $tool ]] || { echo "compare-redis: $tool is missing (build with -DCVDB_BUILD_BENCH=ON)" >&2; exit 2; }
done
if ! command -v redis-server >/dev/null || ! command -v redis-benchmark >/dev/null; then
  echo "compare-redis: installing redis-server and redis-tools" >&2
  apt-get update -q >/dev/null
  apt-get install -y -q redis-server redis-tools >/dev/null
fi

work=$(mktemp -d)
server_pid=
redis_pid=
cleanup() {
  if [[ -n $server_pid ]]; then kill "$server_pid" 2>/dev/null || true; wait "$server_pid" 2>/dev/null || true; fi
  if [[ -n $redis_pid ]]; then kill "$redis_pid" 2>/dev/null || true; wait "$redis_pid" 2>/dev/null || true; fi
  rm -rf "$work"
}
trap cleanup EXIT
trap 'exit 130' INT TERM

echo "compare-redis: $(nproc) cores, $runs run(s) of ${seconds} s each; load average at start: $(cut -d' ' -f1-3 /proc/loadavg)"
[[ -z $server_config ]] || echo "compare-redis: cvdbserver settings added: $server_config"

# cvdbserver on a free port, its databases in the temporary folder.
mkdir -p "$work/home/db" "$work/log"
echo "{\"ServerPort\": 0, \"ForceIP4\": true${server_config:+, $server_config}}" >"$work/home/db/config.json"
"$server_bin" --home "$work/home" --log-dir "$work/log" --console >"$work/server.out" 2>&1 &
server_pid=$!
port=
for _ in $(seq 200); do
  port=$(sed -n 's/.*Listening on port \([0-9]*\).*/\1/p' "$work/server.out" | head -1)
  [[ -n $port ]] && break
  sleep 0.05
done
[[ -n $port ]] || { echo "compare-redis: cvdbserver did not start" >&2; cat "$work/server.out" >&2; exit 1; }

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
redis-cli -p "$redis_port" ping >/dev/null || { echo "compare-redis: redis-server did not start" >&2; exit 1; }

# ---------------------------------------------------------------- measuring
# Every measurement prints "ops/s p50-us p99-us".

# A field of load_gen's JSON line.
field() { sed -n "s/.*\"$2\":\([0-9.]*\).*/\1/p" <<<"$1"; }

ours() {  # load_gen arguments (run_seconds, when set, overrides SECONDS_PER_RUN)
  local out
  out=$("$load_gen" --port "$port" --seconds "${run_seconds:-$seconds}" --json "$@") || {
    echo "compare-redis: load_gen $* failed: $out" >&2
    exit 1
  }
  echo "$(field "$out" ops_per_sec) $(field "$out" p50_us) $(field "$out" p99_us)"
}

# The Redis counterpart of a load_gen command, through load_gen's own loop.
redis_loop() {
  local out
  out=$("$load_gen" --redis --port "$redis_port" --seconds "$seconds" --json "$@") || {
    echo "compare-redis: load_gen --redis $* failed: $out" >&2
    exit 1
  }
  echo "$(field "$out" ops_per_sec) $(field "$out" p50_us) $(field "$out" p99_us)"
}

# redis-benchmark, sized to run about SECONDS_PER_RUN after a short probe.
# CSV: "test","rps","avg","min","p50","p95","p99","max" (ms).
redis_bench() {  # -c N and the test's arguments
  local probe rps n
  probe=$(redis-benchmark -p "$redis_port" --csv -n 2000 "$@" | tail -1 | tr -d '"' | cut -d, -f2)
  rps=${probe%.*}
  n=$((rps * seconds))
  ((n < 2000)) && n=2000
  redis-benchmark -p "$redis_port" --csv -n "$n" "$@" | tail -1 | tr -d '"' |
    awk -F, '{ printf "%.1f %.1f %.1f\n", $2, $5 * 1000, $7 * 1000 }'
}

median() { sort -g | awk '{ v[NR] = $1 } END { if (NR == 0) print 0; else print v[int((NR + 1) / 2)] }'; }

# Runs both sides RUNS times, alternating, and prints one table row with
# the medians: name, target ratio (or -), our command, their command (or -).
printf '\n%-40s %10s %9s %9s %10s %9s %9s %6s  %s\n' "workload" "ops/s" "p50 us" "p99 us" \
  "Redis" "p50 us" "p99 us" "ratio" "target"
row() {
  local name=$1 target=$2 our_cmd=$3 their_cmd=$4 i a b c
  local -a oo=() op5=() op9=() to=() tp5=() tp9=()
  for ((i = 0; i < runs; i++)); do
    read -r a b c < <(eval "$our_cmd")
    oo+=("$a"); op5+=("$b"); op9+=("$c")
    [[ $their_cmd == - ]] && continue
    read -r a b c < <(eval "$their_cmd")
    to+=("$a"); tp5+=("$b"); tp9+=("$c")
  done
  local mo mp5 mp9
  mo=$(printf '%s\n' "${oo[@]}" | median); mp5=$(printf '%s\n' "${op5[@]}" | median)
  mp9=$(printf '%s\n' "${op9[@]}" | median)
  last_ours=$mo
  if [[ $their_cmd == - ]]; then
    printf '%-40s %10.0f %9.0f %9.0f %10s %9s %9s %6s\n' "$name" "$mo" "$mp5" "$mp9" - - - -
    return
  fi
  local mt mtp5 mtp9 ratio verdict=""
  mt=$(printf '%s\n' "${to[@]}" | median); mtp5=$(printf '%s\n' "${tp5[@]}" | median)
  mtp9=$(printf '%s\n' "${tp9[@]}" | median)
  ratio=$(awk -v a="$mo" -v b="$mt" 'BEGIN { printf "%.2f", (b > 0 ? a / b : 0) }')
  if [[ $target != - ]]; then
    verdict=$(awk -v r="$ratio" -v t="$target" 'BEGIN { print (r >= t ? ">= " t " met" : ">= " t " MISSED") }')
  fi
  # At 50 connections our p99 may be at most three times Redis's.
  if [[ $name == *"50 conn"* ]]; then
    verdict+=$(awk -v a="$mp9" -v b="$mtp9" -v sep="${verdict:+; }" 'BEGIN { x = (b > 0 ? a / b : 0);
      printf "%sp99 %.1fx%s", sep, x, (x <= 3 ? "" : " (over 3x)") }')
  fi
  printf '%-40s %10.0f %9.0f %9.0f %10.0f %9.0f %9.0f %6s  %s\n' "$name" "$mo" "$mp5" "$mp9" "$mt" "$mtp5" "$mtp9" \
    "$ratio" "$verdict"
}

wants() { [[ " $only " == *" $1 "* ]]; }

if wants kv; then
  row "ping, 1 conn" - "ours --command ping -c 1" "redis_bench -c 1 -t ping_mbulk"
  row "ping, 50 conn" 0.8 "ours --command ping -c 50" "redis_bench -c 50 -t ping_mbulk"
  row "100 B config read, 1 conn" - "ours --command getcfg -c 1" "redis_bench -c 1 -t get -d 100"
  row "100 B config read, 50 conn" 1 "ours --command getcfg -c 50" "redis_bench -c 50 -t get -d 100"
  row "  (Redis GET through load_gen's loop)" 0.7 "ours --command getcfg -c 50" "redis_loop --command getcfg -c 50"
  row "100 B durable write, 1 conn" 1 "ours --command setcfg -c 1" "redis_bench -c 1 -t set -d 100"
  redis_one=$(for ((i = 0; i < runs; i++)); do redis_bench -c 1 -t set -d 100; done | cut -d' ' -f1 | median)
  row "100 B durable write, 50 conn, 1 db" 0.5 "ours --command setcfg -c 50" "redis_bench -c 50 -t set -d 100"
  row "100 B durable write, 50 conn, 16 db" 0.7 "ours --command setcfg -c 50 --databases 16" \
    "redis_bench -c 50 -t set -d 100"
  awk -v a="$last_ours" -v b="$redis_one" 'BEGIN {
    r = a / b; printf "%-40s %10.0f %39.0f %6.2f  >= 1 %s\n", "  (against Redis SET with 1 conn)", a, b, r,
      (r >= 1 ? "met" : "MISSED") }'
fi

if wants packs; then
  packs() { ours "$@" --folder-packs "$folder_packs"; }
  row "GetPackInfo, 1 conn" - "packs --command getpackinfo -c 1" "redis_loop --command getpackinfo -c 1"
  row "GetPackInfo, 50 conn, 1 db" 0.7 "packs --command getpackinfo -c 50" "redis_loop --command getpackinfo -c 50"
  row "GetPackInfo, 50 conn, 16 db" 0.7 "packs --command getpackinfo -c 50 --databases 16" \
    "redis_loop --command getpackinfo -c 50"
  # Redis: HGETALL and GET of the content, sent together.
  row "GetPack (record + 10 KiB), 1 conn" - "packs --command getpack -c 1" "redis_loop --command getpack -c 1"
  row "GetPack, 50 conn, 1 db" 0.6 "packs --command getpack -c 50" "redis_loop --command getpack -c 50"
  row "GetPack, 50 conn, 16 db" 0.6 "packs --command getpack -c 50 --databases 16" \
    "redis_loop --command getpack -c 50"
  echo "GetPackInfos of $folder_packs records (target: p50 under 50 ms with 1 connection):"
  row "GetPackInfos, 1 conn" - "packs --command getpackinfos -c 1" -
  # 50 listings at once take seconds each: longer runs.
  run_seconds=$((seconds > 20 ? seconds : 20))
  row "GetPackInfos, 50 conn, 1 db" - "packs --command getpackinfos -c 50" -
  row "GetPackInfos, 50 conn, 16 db" - "packs --command getpackinfos -c 50 --databases 16" -
  run_seconds=
  # Writes last: the reads above see databases that bursts of writes have
  # not just grown.
  row "SavePack 1 KiB + 10 KiB, 1 conn" 1 "packs --command savepack -c 1" "redis_loop --command savepack -c 1"
  row "SavePack, 50 conn, 1 db" 0.5 "packs --command savepack -c 50" "redis_loop --command savepack -c 50"
  row "SavePack, 50 conn, 16 db" - "packs --command savepack -c 50 --databases 16" \
    "redis_loop --command savepack -c 50"
fi

if wants files; then
  # The disk's sequential rates in MiB/s: a write synced at its end, and a
  # read that bypasses the page cache.
  disk_write() {
    dd if=/dev/zero of="$work/dd.bin" bs=1M count=256 conv=fdatasync 2>&1 | tail -1 |
      awk '{ n = split($0, f, ","); split(f[n - 1], t, " "); printf "%.1f 0 0\n", 256 / t[1] }'
  }
  disk_read() {
    dd if="$work/dd.bin" of=/dev/null bs=1M iflag=direct 2>&1 | tail -1 |
      awk '{ n = split($0, f, ","); split(f[n - 1], t, " "); printf "%.1f 0 0\n", 256 / t[1] }'
  }
  echo "1 MiB data files in MiB/s (= ops/s), against dd on the same disk (the Redis columns):"
  row "1 MiB data-file write, 1 conn" - "ours --command setdata --size 1048576 -c 1" disk_write
  row "1 MiB data-file read, 1 conn" - "ours --command getdata --size 1048576 -c 1" disk_read
  rm -f "$work/dd.bin"
fi

echo
echo "compare-redis: load average at end: $(cut -d' ' -f1-3 /proc/loadavg)"
