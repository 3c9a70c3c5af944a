# The daemon's work per event in one process (frame decode; records and
# their envelope) with its allocations counted, beside nlohmann-json doing
# the JSON side of the same events.
if(TARGET zerith_testsupport)
  zerith_bench(NAME event_path_bench
    SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/EventPathBench.cpp ${CMAKE_CURRENT_SOURCE_DIR}/pipeline/BenchEvent.cpp
    DEPS zerith_backends zerith_config zerith_transport zerith_ipc zerith zerith_platform
         zerith_testsupport)
endif()
