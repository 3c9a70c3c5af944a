# End-to-end round trips against the real daemon, beside a bare Unix-socket
# echo of the same frame sizes. Needs the test support library (the daemon
# runner and temporary roots).
if(TARGET zerith_testsupport)
  zerith_bench(NAME e2e_bench SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/E2eDisplayURLBench.cpp ${CMAKE_CURRENT_SOURCE_DIR}/pipeline/ProcStats.cpp
    DEPS zerith zerith_ipc zerith_platform zerith_testsupport)
  add_dependencies(e2e_bench zerithd)
  target_compile_definitions(e2e_bench PRIVATE ZERITHD_BUILT_BINARY="$<TARGET_FILE:zerithd>")
endif()
