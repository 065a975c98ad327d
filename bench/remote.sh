#!/bin/bash
# Extracting and listing bench's archives over HTTP beside the local file.
# nginx serves the corpus from a network namespace reached through a veth
# pair with netem on the host's end (or, without netem, a delaying forwarder
# between two tun devices) adding the latency to every round trip.
# Output goes to tmpfs on both sides, so the network is what is measured.
#
#   bench/remote.sh [BUILD_DIR]      (as root; DELAY=20ms RUNS=3 by default)
set -u
BUILD=$(cd "${1:-build}" && pwd)
GW=${GW:-$BUILD/gwarchive}
CORPUS=$(readlink -f "$BUILD/bench-corpus")
DELAY=${DELAY:-20ms}
RUNS=${RUNS:-3}
NS=gwbench$$
HOST_END=gwbh$$
NS_END=gwbn$$
HOST_IP=10.231.$(($$ % 250)).1
SERVER_IP=10.231.$(($$ % 250)).2
PORT=8080
SCRATCH=$(mktemp -d /dev/shm/gwbench-remote.XXXXXX)

skip() {
    echo "remote benchmark skipped: $*"
    rm -rf "$SCRATCH"
    exit 0
}

[ "$(id -u)" = 0 ] || skip "needs root for a network namespace"
for tool in ip tc nginx cc; do
    command -v $tool >/dev/null || skip "$tool is not installed"
done
[ -x "$GW" ] || skip "no $GW"
for name in large.zip small.zip list.zip; do
    [ -f "$CORPUS/$name" ] || skip "no $CORPUS/$name (make bench builds the corpus)"
done

NGINX_PID=
cleanup() {
    [ -n "$FORWARDER_PID" ] && kill "$FORWARDER_PID" 2>/dev/null
    [ -n "$NGINX_PID" ] && kill "$NGINX_PID" 2>/dev/null && wait "$NGINX_PID" 2>/dev/null
    ip link del "$HOST_END" 2>/dev/null
    ip netns del "$NS" 2>/dev/null
    rm -rf "$SCRATCH"
}
trap cleanup EXIT
trap 'exit 1' INT TERM

ip netns add "$NS" || skip "cannot make a network namespace"
ip netns exec "$NS" ip link set lo up
# netem on a veth pair where the kernel has it; else a tun pair joined by a
# forwarder that delays each packet (half the latency each way).
FORWARDER_PID=
if ip link add "$HOST_END" type veth peer name "$NS_END" 2>/dev/null &&
    tc qdisc add dev "$HOST_END" root netem delay 1ms 2>/dev/null; then
    tc qdisc del dev "$HOST_END" root
    LINK=netem
    ip link set "$NS_END" netns "$NS"
else
    ip link del "$HOST_END" 2>/dev/null
    LINK=forwarder
    ip tuntap add dev "$HOST_END" mode tun || skip "cannot make a tun device"
    ip netns exec "$NS" ip tuntap add dev "$NS_END" mode tun
    cc -O2 -o "$SCRATCH/delay_link" "$(dirname "$0")/delay_link.c" || skip "cannot build the forwarder"
    ip link set "$HOST_END" mtu 9000
    ip netns exec "$NS" ip link set "$NS_END" mtu 9000
fi
ip addr add "$HOST_IP" peer "$SERVER_IP" dev "$HOST_END"
ip link set "$HOST_END" up
ip netns exec "$NS" ip addr add "$SERVER_IP" peer "$HOST_IP" dev "$NS_END"
ip netns exec "$NS" ip link set "$NS_END" up

# Latency added to every round trip from now on: "0ms" or "20ms".
set_delay() {
    if [ $LINK = netem ]; then
        tc qdisc del dev "$HOST_END" root 2>/dev/null
        [ "$1" = 0ms ] || tc qdisc add dev "$HOST_END" root netem delay "$1" limit 100000
        return
    fi
    [ -n "$FORWARDER_PID" ] && kill "$FORWARDER_PID" && wait "$FORWARDER_PID" 2>/dev/null
    local seconds
    seconds=$(echo "${1%ms} / 2000" | bc -l)
    "$SCRATCH/delay_link" "$HOST_END" "$NS" "$NS_END" "$seconds" >"$SCRATCH/link" &
    FORWARDER_PID=$!
    for _ in $(seq 50); do
        grep -q ready "$SCRATCH/link" 2>/dev/null && return
        sleep 0.1
    done
}
set_delay 0ms

mkdir -p "$SCRATCH/nginx"
cat >"$SCRATCH/nginx/nginx.conf" <<EOF
daemon off;
master_process off;
worker_processes 1;
pid $SCRATCH/nginx/nginx.pid;
error_log $SCRATCH/nginx/error.log warn;
events { worker_connections 1024; }
http {
  access_log $SCRATCH/nginx/access.log;
  client_body_temp_path $SCRATCH/nginx/body;
  proxy_temp_path $SCRATCH/nginx/proxy;
  fastcgi_temp_path $SCRATCH/nginx/fastcgi;
  uwsgi_temp_path $SCRATCH/nginx/uwsgi;
  scgi_temp_path $SCRATCH/nginx/scgi;
  default_type application/octet-stream;
  sendfile on;
  keepalive_requests 1000000;
  server { listen $SERVER_IP:$PORT; root $CORPUS; location / { } }
}
EOF
ip netns exec "$NS" nginx -p "$SCRATCH/nginx" -c "$SCRATCH/nginx/nginx.conf" &
NGINX_PID=$!
for _ in $(seq 50); do
    (exec 3<>"/dev/tcp/$SERVER_IP/$PORT") 2>/dev/null && break
    sleep 0.1
done
(exec 3<>"/dev/tcp/$SERVER_IP/$PORT") 2>/dev/null || skip "nginx did not start"

requests() { wc -l <"$SCRATCH/nginx/access.log"; }

# Median wall time of RUNS runs of "$@", and the requests the last run made.
measure() {
    local times=() before after start end
    for _ in $(seq "$RUNS"); do
        rm -rf "$SCRATCH/out"
        mkdir -p "$SCRATCH/out"
        sync
        before=$(requests)
        start=$(date +%s.%N)
        "$@" >/dev/null 2>"$SCRATCH/err" || {
            echo "failed: $* ($(head -c 300 "$SCRATCH/err"))" >&2
            return 1
        }
        end=$(date +%s.%N)
        after=$(requests)
        times+=("$(echo "$end - $start" | bc)")
    done
    rm -rf "$SCRATCH/out"
    MEDIAN=$(printf '%s\n' "${times[@]}" | sort -n | sed -n "$(((RUNS + 1) / 2))p")
    REQUESTS=$((after - before))
}

URL=http://$SERVER_IP:$PORT
echo "latency by $LINK; median of $RUNS runs; requests of one run"
printf '%-22s %10s %12s %9s %10s %12s %9s\n' workload "local s" "remote 0ms" requests \
    "+$DELAY" "ratio" requests
run_row() {
    local label=$1 command=$2 name=$3 extra=$4 local_s plain_s plain_n delayed_s delayed_n
    measure $GW $command $extra "$CORPUS/$name" || return
    local_s=$MEDIAN
    set_delay 0ms
    measure $GW $command $extra "$URL/$name" || return
    plain_s=$MEDIAN plain_n=$REQUESTS
    set_delay "$DELAY"
    measure $GW $command $extra "$URL/$name" || return
    delayed_s=$MEDIAN delayed_n=$REQUESTS
    printf '%-22s %10.3f %12.3f %9d %10.3f %11.2fx %9d\n' "$label" "$local_s" "$plain_s" \
        "$plain_n" "$delayed_s" "$(echo "$delayed_s / $local_s" | bc -l)" "$delayed_n"
}

run_row "extract large.zip" extract large.zip "--no-progress -C $SCRATCH/out"
run_row "extract small.zip" extract small.zip "--no-progress -C $SCRATCH/out"
run_row "list list.zip" list list.zip ""
