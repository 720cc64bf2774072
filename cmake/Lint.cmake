# The `lint` target: clang-tidy, with the checks of the top-level .clang-tidy,
# over the library sources (Messaging/Src, Platform/*/src), compiled as the
# build compiles them (the compile database of this build directory).
# Findings are reported, not fatal; skipped with a message when clang-tidy
# is not installed.
#
#   cmake --build build/default --target lint
set(CMAKE_EXPORT_COMPILE_COMMANDS ON)

find_program(TARN_CLANG_TIDY NAMES clang-tidy clang-tidy-14)
if(NOT TARN_CLANG_TIDY)
  message(STATUS "clang-tidy not found: the lint target is not available")
  return()
endif()

file(GLOB tarn_lint_sources CONFIGURE_DEPENDS
  ${CMAKE_CURRENT_SOURCE_DIR}/Messaging/Src/*.cpp
  ${CMAKE_CURRENT_SOURCE_DIR}/Platform/*/src/*.cpp)
list(SORT tarn_lint_sources)
add_custom_target(lint
  # g++ compiles as gnu++17 by default, so the database may carry no -std
  # flag; clang-tidy's own default is older.
  COMMAND ${TARN_CLANG_TIDY} -p ${CMAKE_BINARY_DIR} --quiet --extra-arg=-std=c++17 ${tarn_lint_sources}
  WORKING_DIRECTORY ${CMAKE_CURRENT_SOURCE_DIR}
  COMMENT "clang-tidy over the library sources"
  VERBATIM)
