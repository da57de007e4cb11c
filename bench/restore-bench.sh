#!/usr/bin/env bash
# Restore of a backup archive against unzip(1) of the same archive, in one
# run on one disk. One database holds a data tree of MIB MiB: files of
# mixed sizes (512 bytes to 4 MiB, spread evenly on a log scale) in 300 id
# folders, every other file random bytes and the others text that deflate
# shrinks about fourfold. `cvdb backup` archives it through the server;
# then, alternating, RUNS times each:
#   (a) `cvdb --db bench restore`: the server unpacks the archive and syncs
#       every file, places the database file, puts the new data folder in
#       place of the previous one and removes the previous one;
#   (b) `unzip -q` of the same archive into a fresh folder, then `sync`.
# Before each timed step `sync` writes out what the step before left dirty;
# removing the previous unzip output is not timed. Prints the medians, the
# throughputs (MB of the tree per second) and their ratio, and the rise of
# the server's resident memory during a restore: VmHWM after it (the peak
# reset through clear_refs just before) against VmRSS before it, the
# largest of the runs. Checks that the restored tree has every file of the
# original and equals what unzip unpacked.
#
#   bench/restore-bench.sh [build-dir]      (default: build)
#
# Settings (environment): MIB=1024, RUNS=5, DIR=the folder for the work
# (default: TMPDIR, else /tmp), which needs about 4.5 times MIB free (the
# script checks with df first). Everything lives in a temporary folder
# there, removed at the end; the server does not outlive the script.
set -euo pipefail

build=${1:-build}
mib=${MIB:-1024}
runs=${RUNS:-5}
base=${DIR:-${TMPDIR:-/tmp}}
server_bin=$build/src/service/cvdbserver
cvdb=$build/client/cvdb
for tool in "$server_bin" "$cvdb"; do
  [[ -x $tool ]] || { echo "restore-bench: $tool is missing" >&2; exit 2; }
done
command -v unzip >/dev/null || { echo "restore-bench: unzip is missing (apt-get install unzip)" >&2; exit 2; }

need_kib=$((mib * 1024 * 9 / 2))
free_kib=$(df -Pk "$base" | awk 'NR == 2 {print $4}')
if ((free_kib < need_kib)); then
  echo "restore-bench: $base has $((free_kib / 1024)) MiB free, the run needs $((need_kib / 1024)) MiB;" \
    "set DIR to a folder with room" >&2
  exit 2
fi

work=$(mktemp -d "$base/restore-bench.XXXXXX")
server_pid=
cleanup() {
  [[ -n $server_pid ]] && kill "$server_pid" 2>/dev/null && wait "$server_pid" 2>/dev/null
  rm -rf "$work"
}
trap cleanup EXIT

echo "restore-bench: $(nproc) cores, load average $(cut -d' ' -f1-3 /proc/loadavg) at the start," \
  "work folder $work ($(df -Ph "$work" | awk 'NR == 2 {print $1 ", " $4 " free"}'))"

port=$((40000 + RANDOM % 20000))
root=$work/home/db
mkdir -p "$root"
printf '{"ServerPort": %d}\n' "$port" >"$root/config.json"
start_server() {
  "$server_bin" --home "$work/home" --log-dir "$work/log" >>"$work/server.out" 2>&1 &
  server_pid=$!
  for _ in $(seq 100); do "$cvdb" --port "$port" ping >/dev/null 2>&1 && break; sleep 0.1; done
}
start_server
"$cvdb" --port "$port" --db bench cfg set probe '{"a": 1}' >/dev/null

# The data tree, written straight into the database's data folder (the
# server reads data files where they lie).
python3 - "$root/bench/d" "$mib" <<'EOF'
import math, os, random, sys
root, target = sys.argv[1], int(sys.argv[2]) << 20
rnd = random.Random(7)
words = [b"invoice ", b"page ", b"total ", b"scanned ", b"line\n", b"42 ", b"customer ", b"date "]
text = b"".join(rnd.choice(words) for _ in range(600000))
lo, hi = math.log(512), math.log(4 << 20)
total = n = 0
while total < target:
    size = max(1, min(int(math.exp(rnd.uniform(lo, hi))), target - total))
    folder = os.path.join(root, "id%03d" % (n % 300))
    os.makedirs(folder, exist_ok=True)
    if n % 2:
        data, name = os.urandom(size), "f%05d.bin" % n
    else:
        start = rnd.randrange(len(text))
        data, name = (text * (size // len(text) + 2))[start:start + size], "f%05d.txt" % n
    with open(os.path.join(folder, name), "wb") as f:
        f.write(data)
    total += size
    n += 1
EOF
sync
files=$(find "$root/bench/d" -type f | wc -l)
bytes=$(find "$root/bench/d" -type f -printf '%s\n' | awk '{s += $1} END {print s}')
t0=$(date +%s.%N)
"$cvdb" --port "$port" --db bench backup >"$work/backup.out" 2>&1 ||
  { cat "$work/backup.out" >&2; exit 1; }
t1=$(date +%s.%N)
archive=$root/db.backup/bench.cvbak
printf 'restore-bench: %d files, %d bytes; backup %.1f s, archive %d bytes\n' "$files" "$bytes" \
  "$(echo "$t1 - $t0" | bc -l)" "$(stat -c %s "$archive")"

# A fresh server for the restores, so that the first one's memory is not
# what the backup left allocated.
kill "$server_pid"
wait "$server_pid" || { echo "restore-bench: the server did not stop cleanly" >&2; exit 1; }
start_server

rss() { awk '/^VmRSS/ {print $2}' "/proc/$server_pid/status"; }
hwm() { awk '/^VmHWM/ {print $2}' "/proc/$server_pid/status"; }
median() { sort -g | awk '{a[NR]=$1} END {print a[int((NR+1)/2)]}'; }

ours=() theirs=() rises=() phases=()
for run in $(seq "$runs"); do
  sync
  before=$(rss)
  echo 5 >"/proc/$server_pid/clear_refs" # the peak starts again from now
  t0=$(date +%s.%N)
  # Each progress line with the time it came: where the time goes.
  "$cvdb" --port "$port" --db bench restore 2>&1 |
    while IFS= read -r line; do echo "$(date +%s.%N) $line"; done >"$work/restore.out" ||
    { cat "$work/restore.out" >&2; exit 1; }
  t1=$(date +%s.%N)
  peak=$(hwm)
  ours+=("$(echo "$t1 - $t0" | bc -l)")
  rises+=("$((peak - before))")
  placing=$(awk '/Metadata restore started/ {print $1; exit}' "$work/restore.out")
  replacing=$(awk '/Replacing binaries/ {print $1; exit}' "$work/restore.out")
  phases+=("unpacking $(printf %.2f "$(echo "$placing - $t0" | bc -l)") s, placing the database file \
$(printf %.2f "$(echo "$replacing - $placing" | bc -l)") s, the data folder and the previous files' removal \
$(printf %.2f "$(echo "$t1 - $replacing" | bc -l)") s")

  rm -rf "$work/unzipped"
  mkdir "$work/unzipped"
  sync
  t0=$(date +%s.%N)
  # Status 1 is a warning only: unzip notes that the entry names use "\".
  (cd "$work/unzipped" && unzip -q "$archive" >"$work/unzip.out" 2>&1) || (($? == 1)) ||
    { cat "$work/unzip.out" >&2; exit 1; }
  sync
  t1=$(date +%s.%N)
  theirs+=("$(echo "$t1 - $t0" | bc -l)")
  printf '  run %d: restore %.2f s (+%d KiB resident; %s), unzip+sync %.2f s\n' "$run" "${ours[-1]}" \
    "${rises[-1]}" "${phases[-1]}" "${theirs[-1]}"
done

restored=$(find "$root/bench/d" -type f | wc -l)
((restored == files)) || { echo "restore-bench: $restored files restored of $files" >&2; exit 1; }
diff -rq "$root/bench/d" "$work/unzipped/d" >&2 ||
  { echo "restore-bench: the restored tree differs from unzip's" >&2; exit 1; }

o=$(printf '%s\n' "${ours[@]}" | median)
t=$(printf '%s\n' "${theirs[@]}" | median)
rise=$(printf '%s\n' "${rises[@]}" | sort -g | tail -n 1)
mb=$(echo "$bytes / 1000000" | bc -l)
printf 'restore-bench: %d MiB in %d files, %d runs each, medians; load average %s at the end\n' "$mib" "$files" \
  "$runs" "$(cut -d' ' -f1-3 /proc/loadavg)"
printf '  cvdb restore            %8.2f s  %7.1f MB/s\n' "$o" "$(echo "$mb / $o" | bc -l)"
printf '  unzip -q + sync         %8.2f s  %7.1f MB/s\n' "$t" "$(echo "$mb / $t" | bc -l)"
printf '  throughput ratio        %8.2f x  (restore / unzip+sync; target >= 1.0)\n' "$(echo "$t / $o" | bc -l)"
printf '  resident memory rise    %8d KiB (largest of the runs; target <= 65536 KiB)\n' "$rise"
