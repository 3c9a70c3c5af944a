# Request/reply round trips over zerith_ipc beside a bare Unix-socket echo of
# the same frame sizes.
zerith_bench(NAME ipc_bench SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/IpcRoundTripBench.cpp
             ${CMAKE_CURRENT_SOURCE_DIR}/pipeline/BenchEvent.cpp DEPS zerith_ipc zerith_platform)
