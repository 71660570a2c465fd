#!/bin/sh
# Runs bench_q7bench five times in each configuration and prints the median throughput, the
# median analyzer and monitor CPU per transaction, and rows held with bytes per row: the
# operator's 10 patterns, then 100 and 1,000 patterns, then 10^3, 10^5 and 10^6 distinct URLs.
#
# Usage: bench/q7bench_series.sh [path/to/bench_q7bench] [runs]
set -eu
bench=${1:-build-release/bin/bench_q7bench}
runs=${2:-5}
[ -x "$bench" ] || { echo "no $bench: build it with make bench" >&2; exit 2; }

# median of the numbers on standard input
median() { sort -n | awk '{ v[NR] = $1 } END { if (NR == 0) print "-"; else print v[int((NR + 1) / 2)] }'; }

printf '%-22s %14s %12s %12s %10s %10s %9s\n' configuration "transactions/s" "analyzer us" \
  "monitor us" "rows held" "bytes/row" "peak MiB"
for config in "" "--patterns 100" "--patterns 1000" "--keys 1000" "--keys 100000" \
  "--keys 1000000"; do
  out=$(mktemp)
  i=0
  while [ "$i" -lt "$runs" ]; do
    # shellcheck disable=SC2086 # the configuration is two words on purpose
    "$bench" $config >>"$out"
    i=$((i + 1))
  done
  rate=$(sed -n 's/^throughput: \([0-9]*\) transactions.*/\1/p' "$out" | median)
  analyzer=$(sed -n 's/.*thread CPU: monitor \([0-9.]*\) s, analyzer \([0-9.]*\) s.*/\2/p' "$out" |
    median)
  monitor=$(sed -n 's/.*thread CPU: monitor \([0-9.]*\) s, analyzer.*/\1/p' "$out" | median)
  records=$(sed -n 's/^records: \([0-9]*\) in.*/\1/p' "$out" | head -n 1)
  rows=$(sed -n 's/.*rows held \([0-9]*\),.*/\1/p' "$out" | head -n 1)
  bytes=$(sed -n 's/.*rows held [0-9]*, \([0-9]*\) bytes per row.*/\1/p' "$out" | median)
  peak=$(sed -n 's/^peak resident memory: \([0-9.]*\) MiB.*/\1/p' "$out" | median)
  printf '%-22s %14s %12.2f %12.2f %10s %10s %9s\n' "${config:-10 patterns}" "$rate" \
    "$(echo "$analyzer $records" | awk '{ print $1 * 1e6 / $2 }')" \
    "$(echo "$monitor $records" | awk '{ print $1 * 1e6 / $2 }')" "$rows" "$bytes" "$peak"
  rm -f "$out"
done
