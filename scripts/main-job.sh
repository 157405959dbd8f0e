#!/usr/bin/env bash
# The main job: builds everything, then moves a file between two
# processes on loopback. Starts dpx-agentd (with its own location broker) on a
# fresh depot in a temporary directory, puts a generated file of 256 MiB
# (DPX_DEMO_MIB) with the dpx client, gets it back to another place, compares
# SHA-256, prints the rates and stops the daemon.
set -euo pipefail
cd "$(dirname "$0")/.."
bash scripts/deps.sh

size_mib=${DPX_DEMO_MIB:-256}
cmake -S . -B build -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
cmake --build build -j"${DPX_JOBS:-2}"

work=$(mktemp -d /tmp/dpx-main.XXXXXX)
daemon=
cleanup() {
  if [ -n "$daemon" ] && kill -0 "$daemon" 2>/dev/null; then
    kill -TERM "$daemon"; wait "$daemon" || true
  fi
  rm -rf "$work"
}
trap cleanup EXIT

mkdir -p "$work/depot" "$work/out"
echo "== generating a file of $size_mib MiB"
head -c "$((size_mib * 1024 * 1024))" /dev/urandom > "$work/source.bin"

# The broker port is the daemon's own; try a few until one is free.
for attempt in 1 2 3 4 5; do
  export NCS_LB_PORT=$((20000 + RANDOM % 30000))
  ./build/bin/dpx-agentd --depot "$work/depot" --product demo --broker --hub \
      > "$work/daemon.out" 2> "$work/daemon.log" &
  daemon=$!
  for _ in $(seq 100); do
    grep -q '^listening on' "$work/daemon.out" 2>/dev/null && break
    kill -0 "$daemon" 2>/dev/null || break
    sleep 0.1
  done
  if grep -q '^listening on' "$work/daemon.out"; then break; fi
  wait "$daemon" || true; daemon=
done
[ -n "$daemon" ] || { echo "dpx-agentd did not start:"; cat "$work/daemon.log"; exit 1; }
echo "== dpx-agentd $(cat "$work/daemon.out") (broker port $NCS_LB_PORT), depot $work/depot/demo"

export DPX_HUBHOST=127.0.0.1
unset AFW_HUB_HOST
bytes=$((size_mib * 1024 * 1024))
rate() { awk -v b="$bytes" -v s="$1" 'BEGIN { printf "%.0f MB/s", b / s / 1e6 }'; }

t0=$(date +%s.%N)
./build/bin/dpx --quiet put node1 demo/source.bin "$work/source.bin"
t1=$(date +%s.%N)
./build/bin/dpx --quiet get node1 demo/source.bin "$work/out/copy.bin"
t2=$(date +%s.%N)

put_s=$(awk -v a="$t0" -v b="$t1" 'BEGIN { print b - a }')
get_s=$(awk -v a="$t1" -v b="$t2" 'BEGIN { print b - a }')
src_sum=$(sha256sum < "$work/source.bin" | cut -d' ' -f1)
depot_sum=$(sha256sum < "$work/depot/demo/demo/source.bin" | cut -d' ' -f1)
copy_sum=$(sha256sum < "$work/out/copy.bin" | cut -d' ' -f1)
echo "put  $size_mib MiB in ${put_s}s: $(rate "$put_s")"
echo "get  $size_mib MiB in ${get_s}s: $(rate "$get_s")"
echo "sha256 source $src_sum"
echo "sha256 depot  $depot_sum"
echo "sha256 copy   $copy_sum"
kill -TERM "$daemon"
daemon_status=0
wait "$daemon" || daemon_status=$?
daemon=
echo "== dpx-agentd stopped with exit status $daemon_status"
if [ "$src_sum" = "$depot_sum" ] && [ "$src_sum" = "$copy_sum" ] && [ "$daemon_status" = 0 ]; then
  echo "OK: the file made the round trip unchanged"
else
  echo "FAILED: the copies differ or the daemon did not stop cleanly"; cat "$work/daemon.log"; exit 1
fi
