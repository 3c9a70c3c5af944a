# zerith_library(NAME <target> DEPS <libs...>)
# One static library per subsystem: every .cpp in the folder (tests excluded).
function(zerith_library)
  cmake_parse_arguments(Z "" "NAME" "DEPS" ${ARGN})
  file(GLOB sources CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/*.cpp)
  add_library(${Z_NAME} STATIC ${sources})
  target_link_libraries(${Z_NAME} PUBLIC ${Z_DEPS})
endfunction()

# zerith_tests(NAME <target> DEPS <libs...>)
# One test executable per subsystem from tests/*.cpp, registered with CTest.
function(zerith_tests)
  cmake_parse_arguments(Z "" "NAME" "DEPS" ${ARGN})
  if(NOT ZERITH_TESTS)
    return()
  endif()
  file(GLOB sources CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/tests/*.cpp)
  if(NOT sources)
    return()
  endif()
  add_executable(${Z_NAME} ${sources})
  target_link_libraries(${Z_NAME} PRIVATE ${Z_DEPS} zerith_testsupport GTest::gtest GTest::gmock GTest::gtest_main)
  gtest_discover_tests(${Z_NAME} DISCOVERY_TIMEOUT 60
    # One variable per property: gtest_discover_tests splits a list value at
    # its ';' however it is escaped, and the second variable would be lost.
    PROPERTIES TIMEOUT 120 ENVIRONMENT "ZERITH_BUILD_DIR=${CMAKE_BINARY_DIR}"
    ENVIRONMENT_MODIFICATION "ZERITH_SOURCE_DIR=set:${CMAKE_SOURCE_DIR}")
endfunction()
