# Makes of ${dir}/tests.txt the CTest entries of the tests, ${dir}/entries.cmake, and the list of
# what the board has to run, ${dir}/groups.txt. Some tests of a program are one group, which shares a
# process: starting one takes longer than most tests. A group is small enough that several boards
# can share the work. Tests of ${here}/left_out.txt are not run, but shown as skipped, with the
# reason there.
cmake_minimum_required(VERSION 3.25)

set(GROUP_SIZE 20)
set(SYSTEM_GROUP_SIZE 4)  # these take longer

file(STRINGS ${dir}/tests.txt tests)
file(STRINGS ${here}/left_out.txt left_out REGEX "^[^#]")

# left_out_reason(RESULT TEST)
function(left_out_reason result test)
  set(${result} "" PARENT_SCOPE)
  foreach(line IN LISTS left_out)
    string(FIND "${line}" " " blank)
    string(SUBSTRING "${line}" 0 ${blank} pattern)
    string(SUBSTRING "${line}" ${blank} -1 reason)
    if(test MATCHES "^${pattern}$")
      string(STRIP "${reason}" reason)
      set(${result} "${reason}" PARENT_SCOPE)
      return()
    endif()
  endforeach()
endfunction()

set(entries "")
set(groups "")
foreach(test IN LISTS tests)
  string(REGEX MATCH "^([^ ]+) (.*)$" ignored "${test}")
  set(program ${CMAKE_MATCH_1})
  set(name ${CMAKE_MATCH_2})

  left_out_reason(reason ${program}.${name})
  if(reason)
    set(arguments "--left-out [==[${reason}]==]")
  else()
    set(size ${GROUP_SIZE})
    if(program STREQUAL "system_tests")
      set(size ${SYSTEM_GROUP_SIZE})
    endif()
    if(NOT DEFINED count_${program})
      set(count_${program} 0)
    endif()
    math(EXPR part "${count_${program}} / ${size} + 1")
    math(EXPR count_${program} "${count_${program}} + 1")
    set(group ${program}.${part})
    if(NOT group IN_LIST groups)
      list(APPEND groups ${group})
      set(program_${group} ${program})
    endif()
    list(APPEND tests_${group} ${name})
    set(arguments "[==[${dir}/share/results/${group}]==] [==[${name}]==]")
  endif()
  string(APPEND entries
    "add_test([==[device.${program}.${name}]==] [==[${here}/show_result]==] ${arguments})\n"
    "set_tests_properties([==[device.${program}.${name}]==] PROPERTIES LABELS device"
    " FIXTURES_REQUIRED board SKIP_REGULAR_EXPRESSION [==[\\[  SKIPPED \\]]==])\n")
endforeach()

set(lines "")
foreach(group IN LISTS groups)
  list(JOIN tests_${group} " " names)
  string(APPEND lines "${group} ${program_${group}} ${names}\n")
endforeach()
file(WRITE ${dir}/entries.cmake "${entries}")
file(WRITE ${dir}/groups.txt "${lines}")
