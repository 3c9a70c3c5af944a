# The end-to-end pipeline benchmark (zerithd beside a peer log pipeline, one
# collector) and its smoke run in the test suite: a few thousand events
# through each pipeline, every one counted exactly once. Needs the test
# support library (daemon runner, HTTPS server, test CA).
if(TARGET zerith_testsupport)
  zerith_bench(NAME e2e_pipeline_bench
    SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/E2ePipelineBench.cpp
            ${CMAKE_CURRENT_SOURCE_DIR}/pipeline/BenchEvent.cpp
            ${CMAKE_CURRENT_SOURCE_DIR}/pipeline/Collector.cpp
            ${CMAKE_CURRENT_SOURCE_DIR}/pipeline/LoadGenerator.cpp
            ${CMAKE_CURRENT_SOURCE_DIR}/pipeline/PeerPipeline.cpp
            ${CMAKE_CURRENT_SOURCE_DIR}/pipeline/ProcStats.cpp
            ${CMAKE_CURRENT_SOURCE_DIR}/pipeline/ZerithdPipeline.cpp
    DEPS zerith_backends zerith_config zerith_transport zerith_ipc zerith zerith_platform
         zerith_testsupport CLI11::CLI11)
  add_dependencies(e2e_pipeline_bench zerithd zerith-collector)
  target_compile_definitions(e2e_pipeline_bench PRIVATE ZERITHD_BUILT_BINARY="$<TARGET_FILE:zerithd>"
                                                        ZERITH_COLLECTOR_TOOL="$<TARGET_FILE:zerith-collector>")
  if(ZERITH_TESTS)
    add_test(NAME e2e_pipeline_smoke
      COMMAND e2e_pipeline_bench --smoke --clients 2 --events 3000 --memory-sample 0)
    set_tests_properties(e2e_pipeline_smoke PROPERTIES TIMEOUT 180)
    # The same with one-way events (no reply per event, one flush at the end).
    add_test(NAME e2e_pipeline_smoke_oneway
      COMMAND e2e_pipeline_bench --smoke --pipelines zerithd --clients 2 --events 3000 --memory-sample 0
              --replies none)
    set_tests_properties(e2e_pipeline_smoke_oneway PROPERTIES TIMEOUT 180)
  endif()
endif()
