#!/usr/bin/env bash
# Cleanup of unused data against find(1) on the same tree, in one run:
# N unused id folders of one small file each, all older than six hours,
# removed by `cvdb cleanup` through the server and by
#   find d -mindepth 1 -maxdepth 1 -mmin +360 -exec rm -rf {} +
# on a copy of the tree. Also the server's resident memory before and at
# its peak, and the latency of configuration reads of another connection
# to the same database during the cleanup against a quiet run.
#
#   bench/cleanup-bench.sh [build-dir]      (default: build)
#
# Settings (environment): IDS=100000 unused id folders, RUNS=3 (medians).
# Everything lives in a temporary folder on the disk of TMPDIR, removed at
# the end; the server does not outlive the script.
set -euo pipefail

build=${1:-build}
ids=${IDS:-100000}
runs=${RUNS:-3}
server_bin=$build/src/service/cvdbserver
cvdb=$build/client/cvdb
for tool in "$server_bin" "$cvdb"; do
  [[ -x $tool ]] || { echo "cleanup-bench: $tool is missing" >&2; exit 2; }
done

work=$(mktemp -d "${TMPDIR:-/tmp}/cleanup-bench.XXXXXX")
server_pid=
cleanup() {
  [[ -n $server_pid ]] && kill "$server_pid" 2>/dev/null && wait "$server_pid" 2>/dev/null
  rm -rf "$work"
}
trap cleanup EXIT

port=$((40000 + RANDOM % 20000))
mkdir -p "$work/home/db"
printf '{"ServerPort": %d}\n' "$port" >"$work/home/db/config.json"
"$server_bin" --home "$work/home" --log-dir "$work/log" >"$work/server.out" 2>&1 &
server_pid=$!
for _ in $(seq 100); do "$cvdb" --port "$port" ping >/dev/null 2>&1 && break; sleep 0.1; done
"$cvdb" --port "$port" --db bench cfg set probe '{"a": 1}' >/dev/null

# The tree of unused, old ids (made once, copied for every run).
python3 - "$work/tree" "$ids" <<'EOF'
import os, sys, time
root, n = sys.argv[1], int(sys.argv[2])
old = time.time() - 7 * 3600
for i in range(n):
    d = os.path.join(root, "id%06d" % i)
    os.makedirs(d)
    with open(os.path.join(d, "page"), "wb") as f:
        f.write(b"x" * 100)
    os.utime(d, (old, old))
EOF

# Configuration reads on one connection until told to stop; prints p50,
# p99 and max in milliseconds.
cat >"$work/reads.py" <<'EOF'
import os, socket, struct, sys, time
port, stop_file = int(sys.argv[1]), sys.argv[2]
def frame(tag, payload=b""): return struct.pack("<IBB", 2 + len(payload), tag, 0) + payload
def s(x): x = x.encode(); return struct.pack("<I", len(x)) + x
def read(so):
    h = b""
    while len(h) < 4: h += so.recv(4 - len(h))
    n = struct.unpack("<I", h)[0]; b = b""
    while len(b) < n: b += so.recv(n - len(b))
so = socket.create_connection(("127.0.0.1", port)); so.setsockopt(socket.IPPROTO_TCP, socket.TCP_NODELAY, 1)
so.sendall(frame(3, s("bench") + struct.pack("<I", 0))); read(so)
lat = []
while not os.path.exists(stop_file):
    t = time.perf_counter(); so.sendall(frame(4, s("probe"))); read(so); lat.append(time.perf_counter() - t)
lat.sort()
pick = lambda q: lat[min(len(lat) - 1, int(q * len(lat)))] * 1000
print("%.3f %.3f %.3f %d" % (pick(0.5), pick(0.99), lat[-1] * 1000, len(lat)))
EOF

rss() { awk '/^VmRSS/ {print $2}' "/proc/$server_pid/status"; }
hwm() { awk '/^VmHWM/ {print $2}' "/proc/$server_pid/status"; }
median() { sort -g | awk '{a[NR]=$1} END {print a[int((NR+1)/2)]}'; }

data="$work/home/db/bench/d"
ours=() theirs=() quiet=() busy=()
rss_before=$(rss)
for run in $(seq "$runs"); do
  # Quiet reads, for the reference latency.
  rm -f "$work/stop"
  python3 "$work/reads.py" "$port" "$work/stop" >"$work/quiet.txt" &
  reader=$!
  sleep 2
  touch "$work/stop"
  wait "$reader"
  quiet+=("$(cut -d' ' -f2 <"$work/quiet.txt")")

  rm -rf "$data" "$work/copy"
  cp -a "$work/tree" "$data"
  cp -a "$work/tree" "$work/copy"
  sync
  rm -f "$work/stop"
  python3 "$work/reads.py" "$port" "$work/stop" >"$work/busy.txt" &
  reader=$!
  t0=$(date +%s.%N)
  "$cvdb" --port "$port" --db bench cleanup >/dev/null 2>&1
  t1=$(date +%s.%N)
  touch "$work/stop"
  wait "$reader"
  busy+=("$(cut -d' ' -f2 <"$work/busy.txt")")
  left=$(find "$data" -mindepth 1 -maxdepth 1 | wc -l)
  [[ $left -eq 0 ]] || { echo "cleanup-bench: $left entries left" >&2; exit 1; }
  ours+=("$(echo "$t1 - $t0" | bc -l)")

  t0=$(date +%s.%N)
  (cd "$work/copy" && find . -mindepth 1 -maxdepth 1 -mmin +360 -exec rm -rf {} +)
  t1=$(date +%s.%N)
  theirs+=("$(echo "$t1 - $t0" | bc -l)")
done
rss_peak=$(hwm)

o=$(printf '%s\n' "${ours[@]}" | median)
t=$(printf '%s\n' "${theirs[@]}" | median)
q=$(printf '%s\n' "${quiet[@]}" | median)
b=$(printf '%s\n' "${busy[@]}" | median)
printf 'cleanup-bench: %d unused old ids, %d runs, medians\n' "$ids" "$runs"
printf '  cvdb cleanup            %8.2f s\n' "$o"
printf '  find -exec rm -rf       %8.2f s\n' "$t"
printf '  ratio (ours / find)     %8.2f\n' "$(echo "$o / $t" | bc -l)"
printf '  resident memory         %8d KiB before, %d KiB peak (+%d KiB)\n' "$rss_before" "$rss_peak" \
  "$((rss_peak - rss_before))"
printf '  reads p99, quiet        %8.3f ms\n' "$q"
printf '  reads p99, during       %8.3f ms\n' "$b"
