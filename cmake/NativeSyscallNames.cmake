# write_native_syscall_names(FILE)
#
# Writes the names of the system calls of the machine that is built for, as its kernel headers have
# them, to FILE: one quoted name per line with a comma behind it, in number order from 0 on. A
# number that has no call gets the name "unusedN". Runs when the build is configured.
function(write_native_syscall_names file)
  set(source ${CMAKE_CURRENT_BINARY_DIR}/native_syscall_numbers.c)
  file(WRITE ${source} "#include <asm/unistd.h>\n")
  execute_process(
    COMMAND ${CMAKE_C_COMPILER} -E -dM ${source}
    OUTPUT_VARIABLE macros
    COMMAND_ERROR_IS_FATAL ANY)
  string(REGEX MATCHALL "#define __NR_[a-z0-9_]+ [0-9]+" definitions "${macros}")

  set(last -1)
  foreach(definition IN LISTS definitions)
    string(REGEX MATCH "__NR_([a-z0-9_]+) ([0-9]+)" ignored "${definition}")
    set(name_${CMAKE_MATCH_2} ${CMAKE_MATCH_1})
    if(CMAKE_MATCH_2 GREATER last)
      set(last ${CMAKE_MATCH_2})
    endif()
  endforeach()
  if(last LESS 0)
    message(FATAL_ERROR "No system-call numbers found in <asm/unistd.h>")
  endif()

  set(text "")
  foreach(number RANGE ${last})
    if(DEFINED name_${number})
      string(APPEND text "\"${name_${number}}\",\n")
    else()
      string(APPEND text "\"unused${number}\",\n")
    endif()
  endforeach()
  # Left alone when nothing has changed, so that configuring again does not compile again.
  file(CONFIGURE OUTPUT ${file} CONTENT "${text}" @ONLY)
endfunction()
