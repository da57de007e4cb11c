#!/usr/bin/env bash
# Backup through the server, in one run on one machine:
#   throughput  `cvdb backup` of a database whose data folder holds a tree
#               of FILES files (MIB MiB in all, half compressible text, half
#               random bytes, in 100 id folders) against `zip -3 -r -q` and
#               `tar -c | pigz -3` of the same tree, alternating, RUNS
#               times; medians, and the ratios of throughput and of
#               compressed size. Our time includes the archive's sync (the
#               server syncs every archive before it names it); the tools'
#               does not.
#   memory      the resident memory of a freshly started server (VmRSS,
#               and the peak VmHWM, reset just before where the kernel
#               allows) read before and after one backup of the database
#               grown to MEM_MIB MiB of data files.
#   interference CONNECTIONS connections writing configuration parts of
#               the same database (bench/load_gen --command setcfg) for
#               LOAD_SECS seconds, without and with backups of it running
#               back to back, alternating, RUNS times; medians of
#               throughput and p99 latency, and their ratios.
#
#   bench/backup-bench.sh [build-dir]      (default: build)
#
# Settings (environment): FILES=10000, MIB=1024, RUNS=5, MEM_MIB=2048,
# LOAD_SECS=5, CONNECTIONS=8. A smoke test: FILES=200 MIB=20 MEM_MIB=40
# RUNS=1 LOAD_SECS=1. Everything lives in a temporary folder on the disk of
# TMPDIR (checked for room first), removed at the end; the server does not
# outlive the script.
set -euo pipefail

build=${1:-build}
files=${FILES:-10000}
mib=${MIB:-1024}
runs=${RUNS:-5}
mem_mib=${MEM_MIB:-2048}
load_secs=${LOAD_SECS:-5}
connections=${CONNECTIONS:-8}
server_bin=$build/src/service/cvdbserver
cvdb=$build/client/cvdb
load_gen=$build/bench/load_gen
for tool in "$server_bin" "$cvdb" "$load_gen"; do
  [[ -x $tool ]] || { echo "backup-bench: $tool is missing" >&2; exit 2; }
done
for tool in zip tar pigz python3 bc; do
  command -v "$tool" >/dev/null || { echo "backup-bench: $tool is not installed" >&2; exit 2; }
done
((mem_mib >= mib)) || mem_mib=$mib

# Room: the tree grown to MEM_MIB, and an archive of it (at most the size of
# its data), and a margin.
tmp=${TMPDIR:-/tmp}
need_kib=$(((2 * mem_mib + 512) * 1024))
free_kib=$(df -Pk "$tmp" | awk 'NR == 2 {print $4}')
if ((free_kib < need_kib)); then
  echo "backup-bench: $((need_kib / 1024)) MiB needed in $tmp, $((free_kib / 1024)) MiB free" >&2
  exit 2
fi

work=$(mktemp -d "$tmp/backup-bench.XXXXXX")
server_pid=
loop_pid=
cleanup() {
  [[ -n $loop_pid ]] && kill "$loop_pid" 2>/dev/null && wait "$loop_pid" 2>/dev/null
  [[ -n $server_pid ]] && kill "$server_pid" 2>/dev/null && wait "$server_pid" 2>/dev/null
  rm -rf "$work"
}
trap cleanup EXIT

port=$((40000 + RANDOM % 20000))
mkdir -p "$work/home/db"
printf '{"ServerPort": %d}\n' "$port" >"$work/home/db/config.json"
start_server() {
  "$server_bin" --home "$work/home" --log-dir "$work/log" >>"$work/server.out" 2>&1 &
  server_pid=$!
  for _ in $(seq 100); do "$cvdb" --port "$port" ping >/dev/null 2>&1 && break; sleep 0.1; done
}
start_server
db=("$cvdb" --port "$port" --db bench)
"${db[@]}" cfg set probe '{"a": 1}' >/dev/null
dbdir="$work/home/db/bench"

# Files of the tree: sizes from a fifth to nine fifths of the average, even
# ones text (words from a small vocabulary, numbers, line breaks), odd ones
# random bytes. $4 prefixes the names, so that the tree can grow.
make_tree() {
  python3 - "$1" "$2" "$3" "$4" <<'EOF'
import os, random, sys
root, n, total, prefix = sys.argv[1], int(sys.argv[2]), int(sys.argv[3]), sys.argv[4]
rng = random.Random(sum(map(ord, prefix)))
words = ("pack document record client the of upload scan invoice 2024 page user lock "
         "status signed copy").split()
out, size = [], 0
while size < 8 << 20:
    w = rng.choice(words) + ("\n" if rng.random() < 0.11 else " ")
    if rng.random() < 0.14:
        w += str(rng.randrange(100000)) + " "
    out.append(w)
    size += len(w)
text = "".join(out).encode()
average = total // n
for i in range(n):
    size = average // 5 + rng.randrange(average * 8 // 5 + 1)
    folder = os.path.join(root, "%s%02d" % (prefix, i % 100))
    os.makedirs(folder, exist_ok=True)
    with open(os.path.join(folder, "%s%d%s" % (prefix, i, ".bin" if i % 2 else ".txt")), "wb") as f:
        if i % 2:
            f.write(os.urandom(size))
        else:
            start = rng.randrange(len(text) - min(size, len(text)) + 1)
            while size > 0:
                piece = text[start:start + size]
                f.write(piece)
                size -= len(piece)
                start = 0
EOF
}

# A backup of the bench database into $1; its progress goes to a file,
# shown when the backup fails.
backup() {
  "${db[@]}" backup "$1" >"$work/backup.out" 2>&1 || {
    cat "$work/backup.out" >&2
    return 1
  }
}
kib() { awk -v f="$2:" '$1 == f {print $2}' "/proc/$1/status"; }
median() { sort -g | awk '{a[NR]=$1} END {print a[int((NR+1)/2)]}'; }
now() { date +%s.%N; }
# The value of a field of load_gen's JSON line.
field() { python3 -c 'import json, sys; print(json.loads(sys.stdin.read())[sys.argv[1]])' "$1"; }

echo "backup-bench: making $files files, $mib MiB, in $dbdir/d" >&2
make_tree "$dbdir/d" "$files" "$((mib << 20))" t
input=$(du -sb "$dbdir/d" | cut -f1)
sync

# (a) Throughput: the three in turn, RUNS times.
ours=() zips=() pigzs=()
for run in $(seq "$runs"); do
  rm -f "$work/ours.cvbak" "$work/z.zip" "$work/t.tgz"
  sync
  t0=$(now)
  backup "$work/ours.cvbak"
  ours+=("$(echo "$(now) - $t0" | bc -l)")
  sync
  t0=$(now)
  (cd "$dbdir" && zip -3 -r -q "$work/z.zip" d)
  zips+=("$(echo "$(now) - $t0" | bc -l)")
  sync
  t0=$(now)
  (cd "$dbdir" && tar -c d | pigz -3 >"$work/t.tgz")
  pigzs+=("$(echo "$(now) - $t0" | bc -l)")
  echo "backup-bench: run $run: cvdb ${ours[-1]} s, zip ${zips[-1]} s, tar|pigz ${pigzs[-1]} s" >&2
done
ours_size=$(stat -c %s "$work/ours.cvbak")
zip_size=$(stat -c %s "$work/z.zip")
pigz_size=$(stat -c %s "$work/t.tgz")
rm -f "$work/ours.cvbak" "$work/z.zip" "$work/t.tgz"

# (c) Interference: writers alone, then writers beside back-to-back backups.
quiet_ops=() quiet_p99=() busy_ops=() busy_p99=()
backups_during=()
writers() {
  "$load_gen" --port "$port" --command setcfg --db bench --connections "$connections" --seconds "$load_secs" --json
}
for run in $(seq "$runs"); do
  writers >"$work/quiet.json"
  quiet_ops+=("$(field ops_per_sec <"$work/quiet.json")")
  quiet_p99+=("$(field p99_us <"$work/quiet.json")")

  rm -f "$work/stop" "$work/loops"
  (
    n=0
    while [[ ! -e $work/stop ]]; do
      backup "$work/busy.cvbak"
      n=$((n + 1))
    done
    echo "$n" >"$work/loops"
  ) &
  loop_pid=$!
  writers >"$work/busy.json"
  touch "$work/stop"
  wait "$loop_pid"
  loop_pid=
  backups_during+=("$(cat "$work/loops")")
  busy_ops+=("$(field ops_per_sec <"$work/busy.json")")
  busy_p99+=("$(field p99_us <"$work/busy.json")")
  echo "backup-bench: writers $run: ${quiet_ops[-1]} ops/s p99 ${quiet_p99[-1]} us alone," \
    "${busy_ops[-1]} ops/s p99 ${busy_p99[-1]} us beside ${backups_during[-1]} backup(s)" >&2
done
rm -f "$work/busy.cvbak"

# (b) Memory: the data grown to MEM_MIB, one backup.
if ((mem_mib > mib)); then
  extra=$((mem_mib - mib))
  echo "backup-bench: adding $extra MiB to the data" >&2
  make_tree "$dbdir/d" "$(((files * extra + mib - 1) / mib))" "$((extra << 20))" m
fi
mem_input=$(du -sb "$dbdir/d" | cut -f1)
sync
# A server of its own, so that what earlier runs left in its heap does not
# hide what this backup takes.
kill "$server_pid"
wait "$server_pid" || true
start_server
"${db[@]}" cfg get probe >/dev/null
rss_before=$(kib "$server_pid" VmRSS)
hwm_before=$(kib "$server_pid" VmHWM)
# Writing 5 to clear_refs resets the peak to the present resident size.
if echo 5 >"/proc/$server_pid/clear_refs" 2>/dev/null; then
  hwm_before=$(kib "$server_pid" VmHWM)
fi
t0=$(now)
backup "$work/mem.cvbak"
mem_secs=$(echo "$(now) - $t0" | bc -l)
hwm_after=$(kib "$server_pid" VmHWM)
rss_after=$(kib "$server_pid" VmRSS)
rm -f "$work/mem.cvbak"

o=$(printf '%s\n' "${ours[@]}" | median)
z=$(printf '%s\n' "${zips[@]}" | median)
p=$(printf '%s\n' "${pigzs[@]}" | median)
qo=$(printf '%s\n' "${quiet_ops[@]}" | median)
qp=$(printf '%s\n' "${quiet_p99[@]}" | median)
bo=$(printf '%s\n' "${busy_ops[@]}" | median)
bp=$(printf '%s\n' "${busy_p99[@]}" | median)
mb=$(echo "$input / 1000000" | bc -l)
printf 'backup-bench: %d files, %.0f MB of data, %d runs, medians\n' "$files" "$mb" "$runs"
printf '  %-28s %10s %10s %12s %10s\n' "" "seconds" "MB/s" "bytes" "of input"
for row in "cvdb backup;$o;$ours_size" "zip -3 -r -q;$z;$zip_size" "tar -c | pigz -3;$p;$pigz_size"; do
  IFS=';' read -r name secs size <<<"$row"
  printf '  %-28s %10.2f %10.1f %12d %9.1f%%\n' "$name" "$secs" "$(echo "$mb / $secs" | bc -l)" "$size" \
    "$(echo "100 * $size / $input" | bc -l)"
done
printf '  %-28s %10.2f (zip / ours; above 1: we are faster)\n' "throughput vs zip -3" "$(echo "$z / $o" | bc -l)"
printf '  %-28s %10.2f\n' "throughput vs tar|pigz -3" "$(echo "$p / $o" | bc -l)"
printf '  %-28s %10.4f (ours / zip)\n' "size vs zip -3" "$(echo "$ours_size / $zip_size" | bc -l)"
printf '  %-28s %10.4f (ours / pigz)\n' "size vs tar|pigz -3" "$(echo "$ours_size / $pigz_size" | bc -l)"
printf '  memory, backup of %.0f MB in %.1f s:\n' "$(echo "$mem_input / 1000000" | bc -l)" "$mem_secs"
printf '  %-28s %10d KiB before, %d KiB after\n' "resident (VmRSS)" "$rss_before" "$rss_after"
printf '  %-28s %10d KiB before, %d KiB after (+%d KiB)\n' "peak (VmHWM)" "$hwm_before" "$hwm_after" \
  "$((hwm_after - hwm_before))"
printf '  %d writers of configuration parts, %s s each:\n' "$connections" "$load_secs"
printf '  %-28s %10.0f ops/s  p99 %8.0f us\n' "alone" "$qo" "$qp"
printf '  %-28s %10.0f ops/s  p99 %8.0f us  (%s backups)\n' "beside backups" "$bo" "$bp" \
  "${backups_during[*]}"
printf '  %-28s %10.2f\n' "throughput ratio (beside/alone)" "$(echo "$bo / $qo" | bc -l)"
printf '  %-28s %10.2f\n' "p99 ratio (beside/alone)" "$(echo "$bp / $qp" | bc -l)"
