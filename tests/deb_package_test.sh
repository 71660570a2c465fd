#!/bin/bash
# The Debian package of a build tree, on this machine: built with cpack from the tree's own
# programs, installed, its programs run from /usr/bin, its user, directories and conffiles, the
# agent started by hand as its user against the package's home, then removed (configuration,
# an operator's edit and the data kept), installed again and purged. Needs root; leaves the
# machine as it found it: no package, no user it made, no process.
#
# usage: deb_package_test.sh BUILD_DIR PACKAGE_VERSION VERSION_TEXT
set -euo pipefail
export LC_ALL=C

build=$1
version=$2
version_text=$3

etc=/etc/q7agent
base=/var/lib/q7agent
logs=/var/log/q7agent
agent_name=$(uname -n | cut -c1-24)
host=$(printf '%s' "$agent_name" | cut -d. -f1)

skip() {
  echo "SKIPPED: $*"
  exit 77
}
fail() {
  echo "FAIL: $*" >&2
  exit 1
}
ok() { echo "ok   $*"; }

# dpkg's state of q7agent: "ii " installed, "rc " configuration left, empty when unknown.
package_state() { dpkg-query -W -f='${db:Status-Abbrev}' q7agent 2>/dev/null || true; }

[ "$(id -u)" = 0 ] || skip "installs a Debian package and adds a system user: run it as root"
for tool in dpkg-deb cpack curl python3 setpriv; do
  command -v $tool >/dev/null || skip "needs $tool"
done
[ -f "$build/CPackConfig.cmake" ] || fail "$build holds no CPack configuration"
case $(package_state) in
  "" | ?n*) ;;
  *) skip "a q7agent package is on this machine already; this test would replace it" ;;
esac
for dir in $etc $base $logs; do
  [ ! -e "$dir" ] || skip "$dir exists: another q7agent's files, which a purge would delete"
done

user_existed=false
if getent passwd q7agent >/dev/null; then
  user_existed=true
fi
work=$(mktemp -d /tmp/q7debXXXXXX)
agent_pid=
started=$SECONDS

# Whatever happened: no agent, no collector, no package, no user of ours.
cleanup() {
  local status=$?
  if [ -n "$agent_pid" ] && kill -0 "$agent_pid" 2>/dev/null; then
    { kill -KILL "$agent_pid" && wait "$agent_pid"; } 2>/dev/null || true
  fi
  if [ -e $base/dpx/sm3ctl ]; then
    for part in collector analyzer; do
      setpriv --reuid=q7agent --regid=q7agent --init-groups /bin/sh $base/dpx/sm3ctl stop $part \
        >/dev/null 2>&1 || true
    done
  fi
  if [ "$status" != 0 ] && [ -f $logs/q7agent.log ]; then
    echo "--- the end of $logs/q7agent.log:" >&2
    tail -n 20 $logs/q7agent.log >&2
  fi
  case $(package_state) in
    "" | ?n*) ;;
    *) dpkg -P q7agent >/dev/null 2>&1 || true ;;
  esac
  if ! $user_existed && getent passwd q7agent >/dev/null; then
    userdel q7agent 2>/dev/null || true
  fi
  if ! $user_existed && getent group q7agent >/dev/null; then
    groupdel q7agent 2>/dev/null || true
  fi
  rm -rf "$work"
  exit "$status"
}
trap cleanup EXIT

# run LOG COMMAND...: the command's output goes to LOG, shown when it fails.
run() {
  local log=$1
  shift
  if ! "$@" >"$log" 2>&1; then
    cat "$log" >&2
    fail "$* failed"
  fi
}

# expect_mode PATH "USER:GROUP MODE"
expect_mode() {
  local actual
  actual=$(stat -c '%U:%G %a' "$1")
  [ "$actual" = "$2" ] || fail "$1 is $actual, not $2"
}

# wait_until SECONDS WHAT COMMAND...: polls COMMAND while the agent lives.
wait_until() {
  local seconds=$1 what=$2
  local deadline=$((SECONDS + seconds))
  shift 2
  until "$@"; do
    kill -0 "$agent_pid" 2>/dev/null || fail "the agent ended while waiting for $what"
    [ "$SECONDS" -lt "$deadline" ] || fail "no $what within $seconds s"
    sleep 0.1
  done
}

# agent_json PATH PYTHON_EXPRESSION: a value from the agent's API reply (bound to j).
agent_json() {
  curl -fsS "http://$addr$1" | python3 -c "import json, sys; j = json.load(sys.stdin); print($2)"
}

# As an operator would run them: no variables of ours, from the root directory.
as_operator() { (cd / && env -i PATH=/usr/sbin:/usr/bin:/sbin:/bin "$@"); }

run "$work/cpack.log" cpack -G DEB --config "$build/CPackConfig.cmake" -B "$work/package"
deb=$(ls "$work"/package/q7agent_*.deb)
[ "$(dpkg-deb -f "$deb" Package)" = q7agent ] || fail "the package is not named q7agent"
[ "$(dpkg-deb -f "$deb" Version)" = "$version" ] || fail "the package's version is not $version"
depends=$(dpkg-deb -f "$deb" Depends)
for dep in adduser libc6 libpcap; do
  case $depends in *"$dep"*) ;; *) fail "Depends lacks $dep: $depends" ;; esac
done
ok "built $(basename "$deb") in $((SECONDS - started)) s: Depends: $depends"

run "$work/install.log" env DEBIAN_FRONTEND=noninteractive dpkg -i "$deb"
touch "$work/installed"
[ "$(package_state)" = "ii " ] || fail "dpkg does not list q7agent as installed"
ok "installed"

[ "$(as_operator q7agent --version)" = "q7agent $version_text" ] ||
  fail "/usr/bin/q7agent --version does not print q7agent $version_text"
as_operator q7ctl --help >/dev/null || fail "/usr/bin/q7ctl --help failed"
ok "q7agent --version and q7ctl --help from /usr/bin"

IFS=: read -r _ _ uid _ _ user_home shell < <(getent passwd q7agent) || fail "no q7agent user"
[ "$uid" -lt 1000 ] || fail "q7agent is not a system user (uid $uid)"
[ "$user_home" = $base ] || fail "q7agent's home is $user_home"
case $shell in */nologin | */false) ;; *) fail "q7agent may log in ($shell)" ;; esac
expect_mode $etc "root:q7agent 775"
expect_mode $base "q7agent:q7agent 750"
expect_mode $logs "q7agent:adm 2750"
ok "system user q7agent (uid $uid); $etc, $base and $logs owned as expected"

conffiles=$(dpkg-query -W -f='${Conffiles}\n' q7agent | awk 'NF { print $1 }' | sort | xargs)
expected="$etc/q7.env $etc/q7agent.cfg $etc/q7details.properties $etc/sm3ctl.conf"
[ "$conffiles" = "$expected" ] || fail "conffiles are '$conffiles', not '$expected'"
[ "$(readlink $etc/"${host}"_q7.cfg)" = q7agent.cfg ] ||
  fail "$etc/${host}_q7.cfg does not lead to q7agent.cfg"
unit=/lib/systemd/system/q7agent.service
grep -qx 'User=q7agent' $unit || fail "$unit does not run as q7agent"
exec_start=$(sed -n 's/^ExecStart=//p' $unit)
[ -x "$exec_start" ] || fail "$unit starts $exec_start, which is not a program"
ok "conffiles: $conffiles; ${host}_q7.cfg -> q7agent.cfg; $unit"

# The agent as the service runs it, on a free port. It starts the simulated collector through
# the package's sm3ctl, and reads the data directory that /etc/q7agent names.
setpriv --reuid=q7agent --regid=q7agent --init-groups \
  env -i PATH=/usr/bin:/bin Q7_HTTP_ADDRESS=127.0.0.1:0 /usr/bin/q7agent \
  >"$work/agent.out" 2>&1 </dev/null &
agent_pid=$!
wait_until 10 "API address in $logs/q7agent.addr" test -s $logs/q7agent.addr
addr=$(cat $logs/q7agent.addr)
[ "$(agent_json /healthz 'j["status"]')" = ok ] || fail "/healthz is not ok"
[ "$(agent_json /api/v1/agent 'j["properties"]["KQ7DPXLOGPATH"]')" = $base/dpx/data ] ||
  fail "the agent did not read KQ7DPXLOGPATH from $etc/${host}_q7.cfg"
ok "agent up as q7agent on http://$addr, configured from $etc"

as_operator q7ctl situation start PackageTest --table Q7TXPTNS APPLICATIN=All APPPATTERN='*' \
  TRANSACTN=Pages TRANSPATTN='*' >/dev/null || fail "q7ctl situation start failed"
expect_mode $etc/q7_situations.json "q7agent:q7agent 600"
as_operator q7ctl situation list | grep -q PackageTest || fail "q7ctl does not list the situation"
ok "q7ctl from /usr/bin found the agent and its token; situations kept in $etc"

records_read() {
  [ "$(agent_json /api/v1/agent 'j.get("counters", {}).get("records_read", 0)')" -gt 0 ]
}
wait_until 15 "records read from $base/dpx/data" records_read
[ "$(stat -c %U $base/dpx/data/traffic.sm3)" = q7agent ] || fail "traffic.sm3 is not q7agent's"
ok "the collector writes $base/dpx/data/traffic.sm3 and the agent reads it"

kill -TERM "$agent_pid"
agent_status=0
wait "$agent_pid" || agent_status=$?
agent_pid=
[ "$agent_status" = 0 ] || fail "the agent exited with $agent_status after SIGTERM"
for pid_file in $base/dpx/linux/zolt414_"$agent_name".pid $base/dpx/linux/zelt_"$agent_name".pid; do
  [ ! -e "$pid_file" ] || fail "$pid_file is left: the collector was not stopped"
done
[ -s $base/odi/dpx/DPXLastFile ] || fail "no $base/odi/dpx/DPXLastFile after a clean stop"
written=$(find /usr/lib/q7agent -newer "$work/installed" | head -n 5)
[ -z "$written" ] || fail "the agent wrote into its home: $written"
ok "agent stopped with its collector; state in $base, nothing written under /usr/lib/q7agent"

echo "# kept across removal" >>$etc/q7.env
run "$work/remove.log" dpkg -r q7agent
[ "$(package_state)" = "rc " ] || fail "after dpkg -r, q7agent's configuration is not kept"
for path in /usr/bin/q7agent /usr/lib/q7agent; do
  [ ! -e "$path" ] || fail "$path is left after dpkg -r"
done
grep -qx "# kept across removal" $etc/q7.env || fail "dpkg -r lost the edit of $etc/q7.env"
for path in $base/odi/dpx/DPXLastFile $base/dpx/data/traffic.sm3; do
  [ -s "$path" ] || fail "dpkg -r deleted $path"
done
ok "dpkg -r kept $etc (with the edit) and $base"

run "$work/reinstall.log" env DEBIAN_FRONTEND=noninteractive dpkg -i "$deb"
grep -qx "# kept across removal" $etc/q7.env || fail "installing again lost the edit of q7.env"
[ "$(as_operator q7agent --version)" = "q7agent $version_text" ] ||
  fail "/usr/bin/q7agent broken once installed again"
ok "installed again over the kept configuration, the edit still there"

run "$work/purge.log" dpkg -P q7agent
case $(package_state) in
  "" | ?n*) ;;
  *) fail "dpkg -P left q7agent as '$(package_state)'" ;;
esac
for path in $etc $base $logs /usr/lib/q7agent $unit; do
  [ ! -e "$path" ] || fail "$path is left after dpkg -P"
done
ok "dpkg -P removed $etc, $base and $logs"
echo "deb_package_test: passed in $((SECONDS - started)) s"
