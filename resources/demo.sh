#!/bin/sh
# make demo: runs q7agent from the demo home in the foreground. The agent starts the simulated
# collector (writer and capture process) through sm3ctl, so traffic flows at once; a helper in
# the background waits for the API, starts a few example situations and says where to look.
# Ctrl-C stops the agent, which stops the collector processes in order.
set -eu
check_only=false
if [ "${1:-}" = --check ]; then
  check_only=true
  shift
fi
home="${1:?usage: demo.sh [--check] DEMO_HOME}"
home="${home%/}/"
bin="${home}bin"

case "$home" in
  *.*)
    echo "make demo: the demo home $home holds a '.'." >&2
    echo "  The agent orders collector files and finds renamed ones by cutting paths at the first" >&2
    echo "  '.', so the demo's data directory must not hold one." >&2
    echo "  Put the demo elsewhere, for example:  make demo DEMO_HOME=/tmp/q7demo" >&2
    exit 2
    ;;
esac
if $check_only; then
  exit 0
fi

# A '-' anywhere in the data directory's path reads as the mark of a renamed file, so a home
# with one (demo-home itself) keeps its collector files in a directory of its own.
data="${home}zorvan6/dpx/data"
case "$home" in
  *-*)
    data="/tmp/q7demo_$(id -u)/data"
    mkdir -p "$data"
    for cfg in "${home}"config/*_q7.cfg; do
      sed -i "s|^KQ7DPXLOGPATH=.*|KQ7DPXLOGPATH=$data|" "$cfg"
    done
    sed -i "s|^DATA_DIR=.*|DATA_DIR=$data|" "${home}zorvan6/dpx/sm3ctl.conf"
    echo "make demo: collector files go to $data (the home's path holds a '-')" >&2
    ;;
esac

export Q7_HOME="$home"
ctl() { "$bin/q7ctl" "$@" >/dev/null; }

# Waits for the API, then defines what the demo looks at.
(
  i=0
  while [ ! -s "${home}logs/q7agent.addr" ] && [ $i -lt 300 ]; do
    sleep 0.1
    i=$((i + 1))
  done
  # Every site under its own name, all its pages as one transaction.
  ctl situation start SiteWide --table Q7TXPTNS APPLICATIN=Sites APPPATTERN='*' \
    TRANSACTN=Pages TRANSPATTN='*' AGGAPSUNIQ=1 AGGTXSUNIQ=0 COLLINSTCS=0 SAMPERCENT=100 \
    IMPORTANCE=50 MRTTHRES=2000
  # The shop's checkout: a tight 250 ms threshold, every instance kept.
  ctl situation start Checkout --table Q7TXPTNS APPLICATIN=Shop APPPATTERN=www.shop.example \
    TRANSACTN=Checkout TRANSPATTN='/shop/checkout*' AGGAPSUNIQ=0 AGGTXSUNIQ=0 COLLINSTCS=1 \
    SAMPERCENT=100 IMPORTANCE=90 MRTTHRES=250
  # Static pages and feeds: two patterns in one situation, one per complete set.
  ctl situation start StaticContent --table Q7TXPTNS \
    APPLICATIN=Static APPPATTERN='*' TRANSACTN='Static pages' TRANSPATTN='*.html' \
    AGGAPSUNIQ=0 AGGTXSUNIQ=0 COLLINSTCS=0 SAMPERCENT=100 IMPORTANCE=20 MRTTHRES=1000 \
    APPLICATIN=Static APPPATTERN='*' TRANSACTN=Feeds TRANSPATTN='*.xml' \
    AGGAPSUNIQ=0 AGGTXSUNIQ=0 COLLINSTCS=0 SAMPERCENT=100 IMPORTANCE=20 MRTTHRES=1000
  # The head office LAN, one row per /24 subnet.
  ctl situation start OfficeLan --table Q7CLNTPTNS CLIENTNA='Head office' CLIENTHOPT='*' \
    CLIENTPPT='10.1.*' AGGUNIQLY=2
  # The example alerts, sampled every 15 s rather than every minute so that the demo shows them.
  for example in "${home}"share/situations/*.json; do
    [ -e "$example" ] || continue
    quick=$(mktemp)
    sed 's/"every": 60/"every": 15/' "$example" > "$quick"
    ctl situation start "$(basename "$example" .json)" --file "$quick"
    rm -f "$quick"
  done
  addr=$(cat "${home}logs/q7agent.addr")
  cat >&2 <<MSG

== q7agent demo is running: dashboard http://${addr}/ ==
Open the dashboard in a browser; rows appear within a few seconds. Home ${home},
API http://${addr}/api/v1/. In another terminal:
  export Q7_HOME=${home}
  ${bin}/q7ctl sample Q7TXSM                     # transactions over the last 24 hours
  ${bin}/q7ctl sample Q7APPCS                    # applications, current 5-minute interval
  ${bin}/q7ctl sample Q7TXINS --limit 5          # checkout instances
  ${bin}/q7ctl situation list
  ${bin}/q7ctl events
  ${bin}/q7ctl top                               # live: busiest applications and transactions
  ${bin}/q7ctl alerts --follow                   # open alerts, then each raise and clear
  curl -s http://${addr}/api/v1/tables/Q7CLNTSM
Ctrl-C here stops the agent and the collector.

MSG
) &

# Summary traces of every unit but the analyzer's, which writes a summary line per record;
# Q7_TRACE=... make demo chooses others.
exec env Q7_TRACE_FILE=- Q7_TRACE="${Q7_TRACE:-*=ERROR|SUMMARY analyzer=ERROR}" "$bin/q7agent"
