# Checks tarn-demo from ctest, without any interpreter beyond CMake:
#   cmake -DDEMO=<path to tarn-demo> -DMODE=summary -P SmokeTest.cmake
#     a short run with --json: exit status 0, and a summary in which every
#     message posted was delivered or dropped by design, none lost, nothing
#     leaked, and every burst autosaved
#   cmake -DDEMO=<path to tarn-demo> -DMODE=trace -P SmokeTest.cmake
#     a short traced run: exit status 0, stdout still one JSON object, and the
#     slowest handlers on stderr with the status-bar station among them
#   cmake -DDEMO=<path to tarn-demo> -DMODE=options -P SmokeTest.cmake
#     bad command lines exit with status 2 and say why on stderr only;
#     --help exits with 0
cmake_minimum_required(VERSION 3.25)

if(NOT DEMO)
  message(FATAL_ERROR "DEMO must name the tarn-demo executable")
endif()

function(expect_equal name actual expected)
  if(NOT "${actual}" STREQUAL "${expected}")
    message(FATAL_ERROR "${name} is '${actual}', expected '${expected}'\nsummary: ${SUMMARY}")
  endif()
endfunction()

if(MODE STREQUAL "summary")
  set(messages 20000)
  execute_process(
    COMMAND "${DEMO}" --workers 3 --messages ${messages} --idle-ms 30 --json
    RESULT_VARIABLE result OUTPUT_VARIABLE SUMMARY ERROR_VARIABLE errors TIMEOUT 60)
  if(NOT result STREQUAL "0")
    message(FATAL_ERROR "tarn-demo exited with '${result}'\nstdout: ${SUMMARY}\nstderr: ${errors}")
  endif()

  # The whole of stdout must be one JSON object.
  string(JSON type ERROR_VARIABLE parseError TYPE "${SUMMARY}")
  if(parseError OR NOT type STREQUAL "OBJECT")
    message(FATAL_ERROR "stdout is not one JSON object (${parseError})\nstdout: ${SUMMARY}")
  endif()
  foreach(key posted delivered dropped_by_design lost leaked_blocks autosaves bursts duplicates ok)
    string(JSON ${key} ERROR_VARIABLE keyError GET "${SUMMARY}" ${key})
    if(keyError)
      message(FATAL_ERROR "the summary has no '${key}': ${keyError}\nsummary: ${SUMMARY}")
    endif()
  endforeach()
  string(JSON p99 GET "${SUMMARY}" latency_us p99)

  expect_equal("posted" "${posted}" "${messages}")
  expect_equal("lost" "${lost}" "0")
  expect_equal("duplicates" "${duplicates}" "0")
  expect_equal("leaked_blocks" "${leaked_blocks}" "0")
  expect_equal("ok" "${ok}" "ON")
  math(EXPR accounted "${delivered} + ${dropped_by_design}")
  expect_equal("delivered + dropped_by_design" "${accounted}" "${posted}")
  if(autosaves LESS bursts)
    message(FATAL_ERROR "${autosaves} autosaves for ${bursts} bursts\nsummary: ${SUMMARY}")
  endif()
  if(delivered EQUAL 0 OR p99 STREQUAL "")
    message(FATAL_ERROR "nothing was delivered\nsummary: ${SUMMARY}")
  endif()
  message(STATUS "tarn-demo: ${posted} posted, ${delivered} delivered, ${dropped_by_design} dropped by design, "
                 "${autosaves} autosaves")

elseif(MODE STREQUAL "trace")
  execute_process(
    COMMAND "${DEMO}" --workers 2 --messages 5000 --idle-ms 30 --json --trace-slow 0
    RESULT_VARIABLE result OUTPUT_VARIABLE SUMMARY ERROR_VARIABLE errors TIMEOUT 60)
  string(JSON ok ERROR_VARIABLE parseError GET "${SUMMARY}" ok)
  if(NOT result STREQUAL "0" OR parseError OR NOT ok STREQUAL "ON")
    message(FATAL_ERROR "traced run: exit status '${result}' (${parseError})\nstdout: ${SUMMARY}\nstderr: ${errors}")
  endif()
  if(NOT errors MATCHES "slowest handlers \\([0-9,]+ deliveries traced" OR NOT errors MATCHES "tarn\\.app\\.status\\.bar")
    message(FATAL_ERROR "traced run: no list of slow handlers on stderr\n${errors}")
  endif()

elseif(MODE STREQUAL "options")
  # One command line per entry, arguments separated by blanks.
  set(badCommandLines
    "--bogus"
    "--workers 0"
    "--workers -3"
    "--messages abc"
    "--messages 12x"
    "--messages=0"
    "--idle-ms"
    "--idle-ms 99999999"
    "--json=yes"
    "--trace-slow"
    "--trace-slow 60001"
    "--quiet extra")
  foreach(shown IN LISTS badCommandLines)
    string(REPLACE " " ";" arguments "${shown}")
    execute_process(
      COMMAND "${DEMO}" ${arguments}
      RESULT_VARIABLE result OUTPUT_VARIABLE output ERROR_VARIABLE errors TIMEOUT 30)
    if(NOT result STREQUAL "2")
      message(FATAL_ERROR "tarn-demo ${shown}: exit status '${result}', expected 2\n${output}${errors}")
    endif()
    if(NOT errors MATCHES "^tarn-demo: ")
      message(FATAL_ERROR "tarn-demo ${shown}: no explanation on stderr\n${errors}")
    endif()
    if(NOT output STREQUAL "")
      message(FATAL_ERROR "tarn-demo ${shown}: wrote to stdout\n${output}")
    endif()
  endforeach()

  execute_process(COMMAND "${DEMO}" --help RESULT_VARIABLE result OUTPUT_VARIABLE output TIMEOUT 30)
  if(NOT result STREQUAL "0" OR NOT output MATCHES "Usage: tarn-demo")
    message(FATAL_ERROR "tarn-demo --help: exit status '${result}'\n${output}")
  endif()

else()
  message(FATAL_ERROR "MODE must be 'summary', 'trace' or 'options', not '${MODE}'")
endif()
