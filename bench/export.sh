#!/usr/bin/env bash
# Export throughput and lag, with nats-server from Debian on loopback ports under a
# temporary folder (every server stopped by its PID at the end):
#   1. bench_export against a local R1 stream, then a 3-node R3 stream: the exporter's rows/s
#      from a full store, interleaved with a bare js_PublishMsgAsync loop (goal: 0.8 of it);
#   2. the daemon exporting to the local R1 stream under 1 client sending with a window of
#      64 (bench_loadgen): the export lag (rows) sampled each second, reported, not asserted.
#   bench/export.sh [--rows N] [--rounds N] [--messages N]
set -euo pipefail
cd "$(dirname "$0")/.."
rows=200000 rounds=3 messages=300000
while [ $# -gt 0 ]; do
  case "$1" in
    --rows) rows=$2; shift 2 ;;
    --rounds) rounds=$2; shift 2 ;;
    --messages) messages=$2; shift 2 ;;
    *) echo "usage: bench/export.sh [--rows N] [--rounds N] [--messages N]" >&2; exit 2 ;;
  esac
done
build=build/default
for b in bench/bench_export bench/bench_loadgen Statistics/qnreportingd; do
  [ -x "$build/$b" ] || { echo "export.sh: build first: cmake --build --preset default" >&2; exit 1; }
done
dir=$(mktemp -d /tmp/qn-export-bench-XXXXXX)
pids=()
cleanup() { for p in "${pids[@]}"; do kill -9 "$p" 2>/dev/null || true; done; rm -rf "$dir"; }
trap cleanup EXIT
port() { python3 -c 'import socket; s=socket.socket(); s.bind(("127.0.0.1",0)); print(s.getsockname()[1])'; }

# server NAME PORT [CLUSTER_PORT ROUTES]
server() {
  local args=(-a 127.0.0.1 -p "$2" -js -sd "$dir/$1" --server_name "$1")
  [ $# -gt 2 ] && args+=(--cluster_name bench --cluster "nats://127.0.0.1:$3" --routes "$4")
  nats-server "${args[@]}" >"$dir/$1.log" 2>&1 &
  pids+=($!)
}

single=$(port)
server r1 "$single"
ports=() routes=""
for i in 0 1 2; do ports+=("$(port)"); c[$i]=$(port); routes+="${routes:+,}nats://127.0.0.1:${c[$i]}"; done
for i in 0 1 2; do server "r3n$i" "${ports[$i]}" "${c[$i]}" "$routes"; done
sleep 2

echo "== local R1 stream"
"$build/bench/bench_export" --nats "nats://127.0.0.1:$single" --replicas 1 --rows "$rows" --rounds "$rounds" --dir "$dir"
echo "== 3-node R3 stream"
urls="nats://127.0.0.1:${ports[0]},nats://127.0.0.1:${ports[1]},nats://127.0.0.1:${ports[2]}"
"$build/bench/bench_export" --nats "$urls" --replicas 3 --rows "$rows" --rounds "$rounds" --dir "$dir"

echo "== lag under 1 client, window 64, exporting to the local R1 stream"
mkdir -p "$dir/home"
"$build/Statistics/qnreportingd" --home "$dir/home" --export-nats "nats://127.0.0.1:$single" \
  --export-stream LAG --export-subject lag --export-create-stream --device-id bench \
  >"$dir/daemon.log" 2>&1 &
daemon=$!
pids+=($daemon)
until [ -S "$dir/home/run/reporting.sock" ]; do sleep 0.1; done
"$build/bench/bench_loadgen" --home "$dir/home" --op send --clients 1 --window 64 \
  --messages "$messages" >"$dir/loadgen.txt" &
load=$!
most=0 samples=""
while kill -0 "$load" 2>/dev/null; do
  sleep 1
  lag=$(python3 -c 'import json,sys; print(json.load(open(sys.argv[1]))["export"]["lag_rows"])' \
        "$dir/home/run/stats.json" 2>/dev/null || echo 0)
  samples+="$lag "
  [ "$lag" -gt "$most" ] && most=$lag
done
wait "$load" || true
cat "$dir/loadgen.txt"
echo "export lag each second (rows): $samples"
echo "largest export lag: $most rows"
