# Compiles every public header alone, with -Wall -Wextra -Wpedantic -Werror,
# so that each one includes what it uses. Inputs: COMPILER, HEADERS (a
# ;-list of "include-root|relative/path.h"), INCLUDES (a ;-list of include
# directories).
set(flags -std=c++17 -fsyntax-only -Wall -Wextra -Wpedantic -Werror -x c++)
foreach(dir IN LISTS INCLUDES)
  list(APPEND flags -I${dir})
endforeach()
set(failed "")
set(count 0)
foreach(header IN LISTS HEADERS)
  execute_process(COMMAND ${CMAKE_COMMAND} -E echo "#include <${header}>"
                  COMMAND ${COMPILER} ${flags} -
                  RESULT_VARIABLE result ERROR_VARIABLE err OUTPUT_VARIABLE out)
  math(EXPR count "${count} + 1")
  if(NOT result EQUAL 0)
    string(APPEND failed "${header}:\n${err}\n")
  endif()
endforeach()
if(NOT failed STREQUAL "")
  message(FATAL_ERROR "headers that do not compile alone with ${COMPILER}:\n${failed}")
endif()
message(STATUS "${count} headers compile alone with ${COMPILER}")
