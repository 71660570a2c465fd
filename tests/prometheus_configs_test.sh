#!/bin/sh
# The example Prometheus configuration under resources/prometheus/: promtool accepts the scrape,
# federation and rule files, and the rules' own unit tests pass. The scrape configuration names
# a CA and a token file; stand-ins are made beside a copy, as an operator's would be.
set -eu
src=$1
work=$(mktemp -d /tmp/q7promXXXXXX)
trap 'rm -rf "$work"' EXIT
cp -r "$src"/. "$work"/
mkdir -p "$work/q7"
: > "$work/q7/ca.pem"
echo token > "$work/q7/token"
cd "$work"
promtool check config prometheus.yml
promtool check config federate.yml
promtool check config vmagent.yml
promtool check rules q7-rules.yml
promtool test rules q7-rules-test.yml
