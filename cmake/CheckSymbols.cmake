# Fails when a shared library exports a dynamic symbol outside its own
# namespace (internal helpers, leaked template instantiations, the standard
# library's or Boost's symbols). Inputs: LIBRARY, NAMESPACE, NM.
execute_process(COMMAND ${NM} -D --defined-only -C ${LIBRARY}
  RESULT_VARIABLE result OUTPUT_VARIABLE symbols ERROR_VARIABLE err)
if(NOT result EQUAL 0)
  message(FATAL_ERROR "nm failed on ${LIBRARY}: ${err}")
endif()
string(REPLACE "\n" ";" lines "${symbols}")
set(count 0)
set(bad "")
foreach(line IN LISTS lines)
  if(line STREQUAL "")
    continue()
  endif()
  # "<address> <type> <name>"
  string(REGEX REPLACE "^[0-9a-f]+ [A-Za-z] " "" name "${line}")
  math(EXPR count "${count} + 1")
  if(name MATCHES "^(${NAMESPACE})::" OR
     name MATCHES "^(typeinfo for|typeinfo name for|vtable for|VTT for|non-virtual thunk to|virtual thunk to) (${NAMESPACE})::")
    continue()
  endif()
  string(APPEND bad "  ${name}\n")
endforeach()
if(NOT bad STREQUAL "")
  message(FATAL_ERROR "${LIBRARY} exports symbols outside ${NAMESPACE}:\n${bad}")
endif()
message(STATUS "${LIBRARY}: ${count} exported symbols, all in ${NAMESPACE}")
