# Run by CPack on the staged tree, after the project is installed under the home
# /usr/lib/q7agent/ and before the package is made. It moves what the agent writes out of the
# home, which stays read-only:
#
#   /usr/lib/q7agent/config   -> /etc/q7agent       configuration (conffiles); the agent also
#                                                    keeps its API token and situations there
#   /usr/lib/q7agent/logs     -> /var/log/q7agent   trace and bound address
#   /usr/lib/q7agent/zorvan6  -> /var/lib/q7agent   the agent's base: history, checkpoint,
#                                                    state, the collector's data, pids, FIFO
#
# The collector's control script must sit in <base>/dpx/ beside its sm3ctl.conf (it finds both
# its configuration and linux/ there), so /var/lib/q7agent/dpx/ holds links to the script, now
# in the home's libexec/, and to /etc/q7agent/sm3ctl.conf. The configuration names
# /var/lib/q7agent/dpx/data as the collector's data directory: no '.' or '-' in it, which the
# agent would misread in file names.

set(root "${CPACK_TEMPORARY_DIRECTORY}")
set(src "${CPACK_Q7_SOURCE_DIR}")
set(home /usr/lib/q7agent)
set(etc /etc/q7agent)
set(base /var/lib/q7agent)

# Directories (each level of the package path DIR) and files made here get the modes dpkg
# expects whatever the umask.
function(q7_make_directory dir)
  string(REPLACE "/" ";" parts "${dir}")
  set(path "${root}")
  foreach(part IN LISTS parts)
    if(part STREQUAL "")
      continue()
    endif()
    string(APPEND path "/${part}")
    if(NOT IS_DIRECTORY "${path}")
      file(MAKE_DIRECTORY "${path}")
      file(CHMOD "${path}" PERMISSIONS OWNER_READ OWNER_WRITE OWNER_EXECUTE GROUP_READ
        GROUP_EXECUTE WORLD_READ WORLD_EXECUTE)
    endif()
  endforeach()
endfunction()

# Renders a configuration template with the package's values for the placeholders that
# resources/install-home.sh fills for `make install`.
function(q7_render template target)
  file(READ "${template}" text)
  string(REPLACE "@HOME@" "${home}/" text "${text}")
  string(REPLACE "@BASE@" "${base}" text "${text}")
  string(REPLACE "@USER@" "q7agent" text "${text}")
  if(text MATCHES "@[A-Z_]+@")
    message(FATAL_ERROR "${template}: ${CMAKE_MATCH_0} has no value in the Debian package")
  endif()
  get_filename_component(dir "${target}" DIRECTORY)
  q7_make_directory("${dir}")
  file(WRITE "${root}${target}" "${text}")
  file(CHMOD "${root}${target}" PERMISSIONS OWNER_READ OWNER_WRITE GROUP_READ WORLD_READ)
endfunction()

function(q7_link target link)
  get_filename_component(dir "${link}" DIRECTORY)
  q7_make_directory("${dir}")
  file(CREATE_LINK "${target}" "${root}${link}" SYMBOLIC)
endfunction()

# Anything else installed where a link now goes would vanish from the package unnoticed.
file(GLOB_RECURSE staged_base LIST_DIRECTORIES false RELATIVE "${root}${home}/zorvan6"
  "${root}${home}/zorvan6/*")
if(NOT staged_base STREQUAL "dpx/sm3ctl")
  message(FATAL_ERROR "Only dpx/sm3ctl may be installed under zorvan6/, which the package "
    "moves to ${base}; found: ${staged_base}")
endif()
foreach(dir config logs libexec)
  if(EXISTS "${root}${home}/${dir}")
    message(FATAL_ERROR "${home}/${dir} is the package's own; nothing may be installed there")
  endif()
endforeach()

q7_make_directory(${home}/libexec)
file(RENAME "${root}${home}/zorvan6/dpx/sm3ctl" "${root}${home}/libexec/sm3ctl")
file(REMOVE_RECURSE "${root}${home}/zorvan6")
q7_link(${base} ${home}/zorvan6)
q7_link(${etc} ${home}/config)
q7_link(/var/log/q7agent ${home}/logs)
q7_link(${home}/libexec/sm3ctl ${base}/dpx/sm3ctl)
q7_link(${etc}/sm3ctl.conf ${base}/dpx/sm3ctl.conf)
q7_link(../lib/q7agent/bin/q7agent /usr/bin/q7agent)
q7_link(../lib/q7agent/bin/q7ctl /usr/bin/q7ctl)

# The host's <host>_q7.cfg is a link to q7agent.cfg, made by postinst: the host name is the
# installing machine's.
set(conffiles "")
foreach(pair
    "resources/host_q7.cfg:q7agent.cfg"
    "resources/q7details.properties:q7details.properties"
    "resources/q7.env:q7.env"
    "collector/sm3ctl.conf.in:sm3ctl.conf")
  string(REPLACE ":" ";" pair "${pair}")
  list(GET pair 0 template)
  list(GET pair 1 name)
  q7_render("${src}/${template}" "${etc}/${name}")
  string(APPEND conffiles "${etc}/${name}\n")
endforeach()
file(WRITE "${CPACK_Q7_CONFFILES}" "${conffiles}")

q7_render("${src}/resources/q7agent.service.in" /lib/systemd/system/q7agent.service)
