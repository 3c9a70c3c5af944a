# Events through a session's dispatcher into two backends (recording sinks
# registered through the backend factory) beside a bare Unix-socket echo of
# the same frames. The daemon side runs in a child process of the benchmark
# itself, so that the test tree's recording backend can be registered.
if(TARGET zerith_testsupport)
  zerith_bench(NAME session_bench SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/SessionDispatchBench.cpp
    ${CMAKE_CURRENT_SOURCE_DIR}/pipeline/BenchEvent.cpp
    DEPS zerith_daemon zerith_session zerith zerith_ipc zerith_platform zerith_testsupport)
endif()
