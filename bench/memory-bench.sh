#!/usr/bin/env bash
# Resident memory of the server under clients that do not read their
# answers and a burst of large writes, in one run on one machine:
#   baseline  VmRSS of a freshly started server whose database is open;
#   peak      the peak resident size (VmHWM, reset to the baseline where the
#             kernel allows, and the largest of VmRSS read every 20 ms)
#             while READERS clients each ask for a DATA_MIB MiB data file
#             (GetData) and never read the answer, one after the other
#             (each as soon as the answer of the one before has begun to
#             arrive, or after 2 s), and then WRITERS clients each store a
#             configuration part of CFG_MB MB (SetCfgPart, a JSON object
#             of ITEM_BYTES-byte items) side by side; the clients that do
#             not read are closed once the writers are done;
#   after     VmRSS AFTER_SECS seconds after the last client has gone.
# It also prints how long each write took and how long each client that
# does not read waited, from its connect to the first bytes of its answer
# (a wait of more than a moment is the memory budget holding its Connect or
# GetData back; "-" for none within 2 s of its request).
#
#   bench/memory-bench.sh [build-dir]      (default: build)
#
# Settings (environment): READERS=8, DATA_MIB=64, WRITERS=2, CFG_MB=150,
# ITEM_BYTES=1000, AFTER_SECS=10, BUDGET_MIB (unset: the server's default;
# written to config.json as MaxBufferedMiB), RCVBUF (unset: the system's;
# else the receive buffer of the clients that do not read, in bytes: on
# loopback the kernel may take tens of MiB of each unread answer into its
# socket buffers, outside the server's resident size, where a distant
# client's window would take far less). Everything lives in a
# temporary folder on the disk of TMPDIR, removed at the end; the server
# does not outlive the script.
set -euo pipefail

build=${1:-build}
readers=${READERS:-8}
data_mib=${DATA_MIB:-64}
writers=${WRITERS:-2}
cfg_mb=${CFG_MB:-150}
item_bytes=${ITEM_BYTES:-1000}
after_secs=${AFTER_SECS:-10}
server_bin=$build/src/service/cvdbserver
cvdb=$build/client/cvdb
pyclient=$(cd "$(dirname "$0")/../tests/pyclient" && pwd)
for tool in "$server_bin" "$cvdb"; do
  [[ -x $tool ]] || { echo "memory-bench: $tool is missing" >&2; exit 2; }
done
command -v python3 >/dev/null || { echo "memory-bench: python3 is not installed" >&2; exit 2; }

work=$(mktemp -d "${TMPDIR:-/tmp}/memory-bench.XXXXXX")
server_pid=
cleanup() {
  [[ -n $server_pid ]] && kill "$server_pid" 2>/dev/null && wait "$server_pid" 2>/dev/null
  rm -rf "$work"
}
trap cleanup EXIT

port=$((40000 + RANDOM % 20000))
mkdir -p "$work/home/db"
if [[ -n ${BUDGET_MIB:-} ]]; then
  printf '{"ServerPort": %d, "MaxBufferedMiB": %d}\n' "$port" "$BUDGET_MIB" >"$work/home/db/config.json"
else
  printf '{"ServerPort": %d}\n' "$port" >"$work/home/db/config.json"
fi
"$server_bin" --home "$work/home" --log-dir "$work/log" >>"$work/server.out" 2>&1 &
server_pid=$!
for _ in $(seq 100); do "$cvdb" --port "$port" ping >/dev/null 2>&1 && break; sleep 0.1; done
"$cvdb" --port "$port" --db bench cfg set probe '{"a": 1}' >/dev/null
# The data file goes straight into the database's data folder.
mkdir -p "$work/home/db/bench/d/big"
head -c "$((data_mib << 20))" /dev/urandom >"$work/home/db/bench/d/big/data.bin"
"$cvdb" --port "$port" --db bench cfg get probe >/dev/null
budget=$(grep -ao 'maximum buffered memory (MiB): [a-z0-9]*' "$work/log/svc/cvdbserver.log" | head -n 1 || true)

python3 - "$pyclient" "$port" "$server_pid" "$readers" "$writers" "$cfg_mb" "$item_bytes" "$after_secs" \
  "${RCVBUF:-0}" <<'EOF'
import select, sys, threading, time
sys.path.insert(0, sys.argv[1])
import cvdbclient as cv

port, pid = int(sys.argv[2]), int(sys.argv[3])
readers, writers, cfg_mb, item_bytes, after_secs, rcvbuf = map(int, sys.argv[4:10])

def kib(field):
    with open(f"/proc/{pid}/status") as f:
        for line in f:
            if line.startswith(field + ":"):
                return int(line.split()[1])

baseline = kib("VmRSS")
try:
    with open(f"/proc/{pid}/clear_refs", "w") as f:
        f.write("5")
    hwm_reset = True
except OSError:
    hwm_reset = False

peak = baseline
sampling = True
def sample():
    global peak
    while sampling:
        peak = max(peak, kib("VmRSS"))
        time.sleep(0.02)
sampler = threading.Thread(target=sample)
sampler.start()

t0 = time.monotonic()
silent, waits = [], []
for i in range(readers):
    start = time.monotonic()
    c = cv.Client("127.0.0.1", port, timeout=None, receive_buffer=rcvbuf or None)
    c.connect("bench")
    c.send_request(cv.GET_DATA, cv.Writer().str("big").str("data.bin").bytes())
    # The answer has begun once its first bytes are readable; none are read.
    ready, _, _ = select.select([c.sock], [], [], 2.0)
    waits.append(f"{time.monotonic() - start:.1f}" if ready else "-")
    silent.append(c)

item = "x" * max(1, item_bytes - 20)
count = cfg_mb * 1000 * 1000 // (len(item) + 20)
text = '{"items":[' + ",".join('{"i":%d,"t":"%s"}' % (n, item) for n in range(count)) + "]}"
payload = cv.Writer().str("big").bool(False).json_opt(text).bytes()
del text
took = [None] * writers
def write(k):
    start = time.monotonic()
    with cv.Client("127.0.0.1", port, timeout=600) as c:
        c.connect("bench")
        c.call(cv.SET_CFG_PART, payload).end()
    took[k] = time.monotonic() - start
threads = [threading.Thread(target=write, args=(k,)) for k in range(writers)]
for t in threads: t.start()
for t in threads: t.join()
for c in silent: c.close()
loaded = time.monotonic() - t0
del payload
sampling = False
sampler.join()
if hwm_reset:
    peak = max(peak, kib("VmHWM"))
time.sleep(after_secs)
after = kib("VmRSS")
mib = lambda k: k / 1024
print(f"memory-bench: {readers} clients not reading GetData answers "
      f"(receive buffer {rcvbuf or 'of the system'}), {writers} SetCfgPart writes of {cfg_mb} MB")
print(f"  waits for answers (s): {' '.join(waits)}; writes took " +
      ", ".join(f"{t:.1f} s" for t in took) + f"; load phase {loaded:.1f} s")
print(f"  baseline VmRSS   {mib(baseline):8.1f} MiB")
print(f"  peak resident    {mib(peak):8.1f} MiB{'' if hwm_reset else ' (sampled; VmHWM could not be reset)'}")
print(f"  after {after_secs:2d} s       {mib(after):8.1f} MiB  ({mib(after - baseline):+.1f} MiB)")
EOF
echo "  server: ${budget:-no memory budget setting}"
