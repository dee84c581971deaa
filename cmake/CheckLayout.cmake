# Checks that every project include follows the arrows between the rooms (docs/architecture.md).
# Run as a build step: cmake -DSOURCE_DIR=<checkout> -P CheckLayout.cmake. Fails, naming each
# offending line, when a file includes a room that its own room may not reach.
#
# A room is a folder; a room may include itself and the rooms listed after it. Folders not listed
# here (tests, bench, fuzz, tools) are free to include anything but the rules are checked for what
# they are built on.

cmake_policy(SET CMP0007 NEW)

# room ; rooms it may include (besides itself)
set(rooms
    "base/|base/"
    "protocol/|base/"
    "platform/[^/]+$|base/ protocol/"
    "platform/linux/time/|base/ platform/[^/]+$"
    "platform/linux/trace/|base/ platform/[^/]+$"
    "platform/linux/files/|base/ platform/[^/]+$"
    "platform/linux/process/|base/ platform/[^/]+$"
    "platform/linux/driverstats/|base/ platform/[^/]+$"
    "platform/linux/dispatch/|base/ platform/[^/]+$ platform/linux/time/"
    "platform/linux/log/|base/ platform/[^/]+$"
    "platform/linux/settings/|base/ platform/[^/]+$ platform/linux/files/"
    "platform/linux/orientation/|base/ platform/[^/]+$"
    "platform/linux/socket/|base/ protocol/ platform/[^/]+$"
    "platform/linux/backend/|base/ platform/[^/]+$ platform/linux/time/"
    "platform/linux/store/|base/ platform/[^/]+$ platform/linux/time/ platform/linux/backend/"
    "platform/linux/kafka/|base/ platform/[^/]+$ platform/linux/time/ platform/linux/backend/"
    "platform/linux/reporting/|base/ platform/[^/]+$ platform/linux/time/ platform/linux/backend/ platform/linux/store/ platform/linux/kafka/"
    "Statistics/Service/main.cpp|base/ protocol/ platform/ Statistics/"
    "Statistics/|base/ protocol/ platform/[^/]+$"
    "client/|base/ protocol/ tavrin/")

file(GLOB_RECURSE sources RELATIVE ${SOURCE_DIR} ${SOURCE_DIR}/base/*.[ch]*
     ${SOURCE_DIR}/protocol/*.[ch]* ${SOURCE_DIR}/platform/*.[ch]* ${SOURCE_DIR}/Statistics/*.[ch]*
     ${SOURCE_DIR}/client/*.[ch]*)
set(violations "")
foreach(source ${sources})
  set(own "")
  set(allowed "")
  foreach(entry ${rooms})
    string(REPLACE "|" ";" parts "${entry}")
    list(GET parts 0 room)
    if(source MATCHES "^${room}")
      set(own "${room}")
      list(LENGTH parts count)
      if(count GREATER 1)
        list(GET parts 1 targets)
        string(REPLACE " " ";" allowed "${targets}")
      endif()
      break()
    endif()
  endforeach()
  if(own STREQUAL "")
    continue()
  endif()
  file(STRINGS ${SOURCE_DIR}/${source} includes REGEX "^#include \"")
  foreach(line ${includes})
    string(REGEX REPLACE "^#include \"([^\"]+)\".*" "\\1" header "${line}")
    if(NOT header MATCHES "/" OR header MATCHES "^${own}")
      continue()  # a file of its own folder
    endif()
    set(ok FALSE)
    foreach(target ${allowed})
      if(header MATCHES "^${target}")
        set(ok TRUE)
        break()
      endif()
    endforeach()
    if(NOT ok)
      string(APPEND violations "\n  ${source}: ${line}")
    endif()
  endforeach()
endforeach()
if(violations)
  message(FATAL_ERROR "includes that run against the rooms' arrows (docs/architecture.md):"
                      "${violations}")
endif()
