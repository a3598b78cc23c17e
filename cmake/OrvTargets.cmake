# orv_add_library(NAME SOURCES ... PUBLIC ... PRIVATE ...): a shared library of ours; its public
# headers lie in include/ beside its CMakeLists.txt.
function(orv_add_library name)
  cmake_parse_arguments(ARG "" "" "SOURCES;PUBLIC;PRIVATE" ${ARGN})
  add_library(${name} SHARED ${ARG_SOURCES})
  target_include_directories(${name} PUBLIC "${CMAKE_CURRENT_SOURCE_DIR}/include"
                                     PRIVATE "${CMAKE_CURRENT_SOURCE_DIR}/src")
  target_link_libraries(${name} PUBLIC ${ARG_PUBLIC} PRIVATE orv_warnings ${ARG_PRIVATE})
endfunction()

# orv_add_test(NAME SOURCES ... LIBS ...): a GoogleTest program; each TEST becomes a ctest case.
function(orv_add_test name)
  cmake_parse_arguments(ARG "" "" "SOURCES;LIBS;INCLUDES" ${ARGN})
  add_executable(${name} ${ARG_SOURCES})
  target_include_directories(${name} PRIVATE "${CMAKE_CURRENT_SOURCE_DIR}" ${ARG_INCLUDES})
  target_link_libraries(${name} PRIVATE orv_warnings GTest::gmock_main ${ARG_LIBS})
  # Optimising test code takes four times as long as compiling it, and gains nothing: the time of a
  # test is spent in what it tests.
  target_compile_options(${name} PRIVATE -O0 -g1)
  # Seconds. A test of five runs for two minutes under a sanitizer beside other work.
  set(patience 120)
  if(ORV_SANITIZE)
    set(patience 600)
  endif()
  gtest_discover_tests(${name} DISCOVERY_TIMEOUT 60 PROPERTIES TIMEOUT ${patience})
endfunction()
