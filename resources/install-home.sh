#!/bin/sh
# Lays out a q7agent home at $PREFIX: bin/ (installed by cmake), lib/, config/, logs/, the
# collector's directory zorvan6/dpx/ (sm3ctl installed by cmake, its sm3ctl.conf, linux/ for
# pid files and the FIFO) and its data directory zorvan6/dpx/data/, and the systemd unit for
# this home in share/q7agent.service.
# Existing configuration files are kept: an operator's edits are never overwritten.
# The templates' placeholders: @HOME@ the home (with its '/'), @BASE@ the agent's base directory
# (no '/'), @USER@ the service's user. The Debian package fills the same ones for its own layout
# (resources/deb/stage.cmake).
set -eu
: "${PREFIX:?PREFIX must name the home directory}"
here=$(cd "$(dirname "$0")" && pwd)
home="${PREFIX%/}/"

mkdir -p "${home}bin" "${home}lib" "${home}config" "${home}logs" "${home}share"
# The collector's data directory named by the default KQ7DPXLOGPATH.
mkdir -p "${home}zorvan6/dpx/data"
mkdir -p "${home}zorvan6/dpx/linux"

host=$(uname -n | cut -c1-24 | cut -d. -f1)
render() {  # render SOURCE TARGET
  sed -e "s|@HOME@|${home}|g" -e "s|@BASE@|${home}zorvan6|g" -e "s|@USER@|root|g" "$1" > "$2.tmp" &&
    chmod 0644 "$2.tmp" && mv "$2.tmp" "$2"
}
install_once() {  # install_once SOURCE TARGET
  if [ -e "$2" ]; then
    echo "kept   $2"
  else
    render "$1" "$2"
    echo "wrote  $2"
  fi
}
install_once "$here/host_q7.cfg" "${home}config/${host}_q7.cfg"
install_once "$here/q7details.properties" "${home}config/q7details.properties"
install_once "$here/q7.env" "${home}config/q7.env"
install_once "$here/../collector/sm3ctl.conf.in" "${home}zorvan6/dpx/sm3ctl.conf"
# Not configuration: operators copy it to /etc/systemd/system/ and change it there.
render "$here/q7agent.service.in" "${home}share/q7agent.service"
echo "wrote  ${home}share/q7agent.service"
