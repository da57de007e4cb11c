#!/usr/bin/env bash
# What TLS costs on the client port: ping and configuration reads at
# CONNECTIONS connections through the client library (load_gen --mode
# client), against one server in plain TCP and one with TLS, in one run;
# then new connections per second (a connect, a ping and a close each, by
# HANDSHAKERS threads) both ways. Each measurement runs RUNS times,
# alternating between the servers; the table shows the medians of
# throughput, p50 and p99 and the ratio TLS / plain.
#
#   bench/tls-bench.sh [build-dir]      (default: build)
#
# Settings (environment): RUNS=3, SECONDS_PER_RUN=5, CONNECTIONS=50,
# HANDSHAKERS=4. The certificates (EC P-256, made with the openssl tool)
# and both servers live in a temporary folder, removed at the end; the
# servers do not outlive the script.
set -euo pipefail

build=${1:-build}
runs=${RUNS:-3}
seconds=${SECONDS_PER_RUN:-5}
connections=${CONNECTIONS:-50}
handshakers=${HANDSHAKERS:-4}
server_bin=$build/src/service/cvdbserver
load_gen=$build/bench/load_gen
cvdb=$build/client/cvdb
for tool in "$server_bin" "$load_gen" "$cvdb"; do
  [[ -x $tool ]] || { echo "tls-bench: $tool is missing" >&2; exit 2; }
done
command -v openssl >/dev/null || { echo "tls-bench: the openssl tool is missing (scripts/setup)" >&2; exit 2; }

work=$(mktemp -d "${TMPDIR:-/tmp}/tls-bench.XXXXXX")
pids=()
cleanup() {
  for pid in "${pids[@]}"; do kill "$pid" 2>/dev/null || true; done
  for pid in "${pids[@]}"; do wait "$pid" 2>/dev/null || true; done
  rm -rf "$work"
}
trap cleanup EXIT

# A CA and a server certificate for 127.0.0.1 from it.
(
  cd "$work"
  openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:P-256 -nodes -keyout ca.key -out ca.pem -days 2 \
    -subj /CN=bench-ca 2>/dev/null
  openssl req -newkey ec -pkeyopt ec_paramgen_curve:P-256 -nodes -keyout server.key -out server.csr \
    -subj /CN=127.0.0.1 2>/dev/null
  printf 'subjectAltName=IP:127.0.0.1\n' >server.ext
  openssl x509 -req -in server.csr -CA ca.pem -CAkey ca.key -CAcreateserial -out server.pem -days 2 \
    -extfile server.ext 2>/dev/null
)

# start_server NAME PORT EXTRA-JSON
start_server() {
  local name=$1 port=$2 extra=$3
  mkdir -p "$work/$name/home/db"
  printf '{"ServerPort": %d%s}\n' "$port" "$extra" >"$work/$name/home/db/config.json"
  "$server_bin" --home "$work/$name/home" --log-dir "$work/$name/log" >"$work/$name/out" 2>&1 &
  pids+=($!)
}
plain_port=$((40000 + RANDOM % 10000))
tls_port=$((50000 + RANDOM % 10000))
start_server plain "$plain_port" ""
start_server tls "$tls_port" ", \"TlsCertFile\": \"$work/server.pem\", \"TlsKeyFile\": \"$work/server.key\""
for _ in $(seq 100); do
  "$cvdb" --port "$plain_port" ping >/dev/null 2>&1 && "$cvdb" --port "$tls_port" --ca "$work/ca.pem" ping \
    >/dev/null 2>&1 && break
  sleep 0.1
done

echo "tls-bench: $(nproc) cores, $runs run(s) of $seconds s; load average at start: $(cut -d' ' -f1-3 /proc/loadavg)"
: >"$work/results"
for run in $(seq "$runs"); do
  for command in ping getcfg; do
    for side in plain tls; do
      if [[ $side == plain ]]; then args=(--port "$plain_port"); else args=(--port "$tls_port" --tls --ca "$work/ca.pem"); fi
      line=$("$load_gen" "${args[@]}" --mode client --json -c "$connections" -t "$seconds" --command "$command") || true
      echo "$side $command $line" >>"$work/results"
    done
  done
  for side in plain tls; do
    if [[ $side == plain ]]; then args=(--port "$plain_port"); else args=(--port "$tls_port" --tls --ca "$work/ca.pem"); fi
    line=$("$load_gen" "${args[@]}" --mode client --json -c "$handshakers" -t "$seconds" --reconnect) || true
    echo "$side connect+ping $line" >>"$work/results"
  done
done

python3 - "$work/results" "$connections" "$handshakers" <<'PY'
import json, statistics, sys
rows = {}
for line in open(sys.argv[1]):
    side, what, text = line.split(" ", 2)
    rows.setdefault((what, side), []).append(json.loads(text))
print(f"{'measurement':<28}{'plain ops/s':>12}{'p50 us':>9}{'p99 us':>9}{'TLS ops/s':>12}{'p50 us':>9}{'p99 us':>9}{'ratio':>7}")
for what, conns in (("ping", sys.argv[2]), ("getcfg", sys.argv[2]), ("connect+ping", sys.argv[3])):
    med = {}
    for side in ("plain", "tls"):
        r = rows[(what, side)]
        med[side] = [statistics.median(x[k] for x in r) for k in ("ops_per_sec", "p50_us", "p99_us")]
    p, t = med["plain"], med["tls"]
    label = f"{what}, {conns} conn."
    print(f"{label:<28}{p[0]:>12.0f}{p[1]:>9.0f}{p[2]:>9.0f}{t[0]:>12.0f}{t[1]:>9.0f}{t[2]:>9.0f}{t[0] / p[0]:>7.2f}")
errors = sum(x["errors"] for r in rows.values() for x in r)
if errors:
    print(f"errors: {errors} (see load_gen's messages above)")
PY
echo "tls-bench: load average at end: $(cut -d' ' -f1-3 /proc/loadavg)"
