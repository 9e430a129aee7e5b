#!/usr/bin/env bash
# Runs qnreportingd and the references side by side, interleaved, and prints the ratios:
#   - reporterID:valid: one at a time      vs a raw Unix-socket ping-pong of the same frames
#   - sendMessage, 1 client, window 64     vs Redis XADD -c 1 -P 64 (200-byte values)
#   - sendMessage, 8 clients, window 64    vs Redis XADD -c 8 -P 64
#   - daemon CPU per durable message       vs Redis XADD CPU with appendfsync everysec
# and on its own: socket-activated start to first reply (through systemd-socket-activate),
# the daemon's RSS with 1,000 idle sessions, and one-at-a-time round trips beside a client
# that floods without reading and one that sends with a window of 1024 (--op neighbours).
# Medians of ROUNDS rounds (default 3). Needs a default build (bench_loadgen, qnreportingd)
# and Debian's redis-server + redis-tools (installed when missing).
#   bench/side_by_side.sh [--rounds N] [--json FILE]   (FILE gets every run's raw figures)
set -euo pipefail
cd "$(dirname "$0")/.."
rounds=3
json_out=""
while [ $# -gt 0 ]; do
  case "$1" in
    --rounds) rounds=$2; shift 2 ;;
    --json) json_out=$2; shift 2 ;;
    *) echo "usage: bench/side_by_side.sh [--rounds N] [--json FILE]" >&2; exit 2 ;;
  esac
done
loadgen=build/default/bench/bench_loadgen
[ -x "$loadgen" ] || { echo "side_by_side: build first: cmake --build --preset default" >&2; exit 1; }
if ! command -v redis-server >/dev/null || ! command -v redis-benchmark >/dev/null; then
  sudo=""; [ "$(id -u)" -ne 0 ] && sudo=sudo
  $sudo apt-get install -y -qq redis-server redis-tools >/dev/null
fi

work=$(mktemp -d)
trap 'for p in "$work"/*.pid; do [ -f "$p" ] && kill "$(cat "$p")" 2>/dev/null; done; rm -rf "$work"' EXIT
value=$(head -c 200 /dev/zero | tr '\0' x)
results="$work/results.jsonl"

# redis NAME AOF ARGS...: a fresh redis-server on a Unix socket, one redis-benchmark run,
# one JSON line with its rate, p99 and the server's CPU seconds per request.
redis() {
  local name=$1 aof=$2; shift 2
  local dir="$work/redis-$name"; mkdir -p "$dir"
  local extra=(--appendonly no)
  [ "$aof" = everysec ] && extra=(--appendonly yes --appendfsync everysec)
  redis-server --port 0 --unixsocket "$dir/sock" --save '' "${extra[@]}" --dir "$dir" \
    --daemonize yes --pidfile "$work/redis.pid" --logfile "$dir/log"
  # Ready once it answers (with AOF on it first loads its files and answers LOADING).
  for _ in $(seq 200); do
    [ -S "$dir/sock" ] && [ "$(redis-cli -s "$dir/sock" ping 2>/dev/null)" = PONG ] && break
    sleep 0.05
  done
  local pid; pid=$(cat "$work/redis.pid")
  local ticks; ticks=$(getconf CLK_TCK)
  local before; before=$(awk '{print $14+$15}' "/proc/$pid/stat")
  local csv; csv=$(redis-benchmark -s "$dir/sock" --csv "$@" | tail -1)
  local after; after=$(awk '{print $14+$15}' "/proc/$pid/stat")
  kill "$pid"; rm -f "$work/redis.pid"
  local n; n=$(printf '%s\n' "$@" | awk 'p{print;exit} $0=="-n"{p=1}')
  python3 - "$name" "$csv" "$before" "$after" "$ticks" "$n" >>"$results" <<'PY'
import csv, json, sys
name, line, before, after, ticks, n = sys.argv[1:]
row = next(csv.reader([line]))
cpu = (float(after) - float(before)) / float(ticks)
print(json.dumps({"name": name, "rate": float(row[1]), "p99_us": float(row[6]) * 1000,
                  "cpu_s_per_million": cpu * 1e6 / float(n)}))
PY
}

daemon() {
  local name=$1; shift
  "$loadgen" --json "$@" | python3 -c "
import json, sys
r = json.loads(sys.stdin.read()); r['name'] = '$name'; r['rate'] = r['accepted_per_s']
r['p99_us'] = r['p99_us']; r['cpu_s_per_million'] = r.get('daemon_cpu_s_per_million', 0)
print(json.dumps(r))" >>"$results"
}

# first_reply: a daemon started by systemd-socket-activate on the first connection (its store
# already created), timed from connect to reply.
first_reply() {
  local home; home=$(mktemp -d -p "$work")
  # An installed daemon finds its store in place: create it first with one run of its own.
  "$(dirname "$loadgen")/../Statistics/qnreportingd" --home "$home" --socket "$home/setup.sock" \
    2>/dev/null &
  local setup=$!
  for _ in $(seq 100); do [ -S "$home/setup.sock" ] && break; sleep 0.02; done
  kill "$setup"; wait "$setup" 2>/dev/null || true
  systemd-socket-activate -l "$home/s.sock" "$(dirname "$loadgen")/../Statistics/qnreportingd" \
    --home "$home" 2>/dev/null &
  local activator=$!
  for _ in $(seq 100); do [ -S "$home/s.sock" ] && break; sleep 0.02; done
  "$loadgen" --json --op first --socket "$home/s.sock" |
    python3 -c "import json,sys; r=json.load(sys.stdin); r['name']='first'; print(json.dumps(r))" >>"$results"
  kill "$activator"; wait "$activator" 2>/dev/null || true
}

for round in $(seq "$rounds"); do
  echo "side_by_side: round $round of $rounds" >&2
  daemon pingpong --op pingpong --messages 50000
  first_reply
  daemon valid --op valid --window 1 --messages 30000
  redis set_c1_p1 no -n 30000 -c 1 -P 1 -t set -d 200
  daemon send_c1 --op send --window 64 --messages 200000
  redis xadd_c1_p64 no -n 300000 -c 1 -P 64 XADD s '*' f "$value"
  daemon send_c8 --op send --clients 8 --window 64 --messages 40000
  redis xadd_c8_p64 no -n 300000 -c 8 -P 64 XADD s '*' f "$value"
  redis xadd_c1_p64_aof everysec -n 300000 -c 1 -P 64 XADD s '*' f "$value"
  daemon neighbours --op neighbours --messages 500000
  daemon idle --op idle --clients 10 --sessions 100 --messages 1
done

python3 - "$results" "$json_out" <<'PY'
import json, statistics, sys, datetime, platform, os
rows = [json.loads(l) for l in open(sys.argv[1])]
def med(name, key):
    return statistics.median(r[key] for r in rows if r["name"] == name)
table = [
    ("reporterID:valid: one at a time", med("valid", "rate"), "raw socket ping-pong", med("pingpong", "rate"), 0.7),
    ("sendMessage c1 W64, accepted", med("send_c1", "rate"), "Redis XADD c1 P64", med("xadd_c1_p64", "rate"), 1.0),
    ("sendMessage c1 W64, durable", med("send_c1", "durable_per_s"), "Redis XADD c1 P64", med("xadd_c1_p64", "rate"), 0.5),
    ("sendMessage c8 W64, accepted", med("send_c8", "rate"), "Redis XADD c8 P64", med("xadd_c8_p64", "rate"), 1.0),
]
rounds = sum(1 for r in rows if r["name"] == "valid")
print(f"side by side, {datetime.date.today()}, {os.cpu_count()} cores, {platform.machine()}, medians of {rounds} round(s)")
print(f"{'workload':36} {'daemon':>12} {'reference':24} {'ref':>12} {'ratio':>6} {'goal':>5}")
for name, ours, ref_name, ref, goal in table:
    print(f"{name:36} {ours:12,.0f} {ref_name:24} {ref:12,.0f} {ours/ref:6.2f} {goal:5.1f}")
print(f"valid p50 {med('valid','p50_us'):.1f} us vs ping-pong p50 {med('pingpong','p50_us'):.1f} us")
print(f"sendMessage c8 W64 p99 {med('send_c8','p99_us'):.0f} us (goal < 2000)")
cpu = med("send_c1", "cpu_s_per_million"); ref = med("xadd_c1_p64_aof", "cpu_s_per_million")
print(f"daemon CPU per durable message {cpu:.2f} us vs Redis XADD AOF everysec {ref:.2f} us: {cpu/ref:.1f}x (goal <= 2x)")
print(f"daemon peak RSS in send c8: {med('send_c8','daemon_peak_rss_kib')/1024:.0f} MiB, "
      f"after its sessions were destroyed: {med('send_c8','daemon_rss_after_kib')/1024:.0f} MiB (goal < 64)")
print(f"socket-activated start to first reply: {med('first','first_reply_us')/1000:.1f} ms (goal < 10)")
print(f"daemon RSS with 1,000 idle sessions: {med('idle','idle_rss_kib')/1024:.1f} MiB (goal < 20)")
print(f"beside a flooder and a window-1024 sender: one-at-a-time round trips p99 "
      f"{med('neighbours','p99_us'):.0f} us (goal < 2000), daemon peak RSS "
      f"{med('neighbours','daemon_peak_rss_kib')/1024:.0f} MiB (goal < 64)")
if sys.argv[2]:
    json.dump(rows, open(sys.argv[2], "w"), indent=1)
PY
