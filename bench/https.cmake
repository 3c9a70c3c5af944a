# The HTTPS post backend: records built and serialised beside nlohmann-json
# building the same objects alone, and a batch of 50 gzip'd and posted to
# zerith-collector on loopback beside libcurl posting the same body.
if(TARGET zerith_testsupport AND TARGET zerith-collector)
  zerith_bench(NAME https_bench SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/HTTPSPostBench.cpp
    DEPS zerith_backends zerith_config zerith_transport zerith_testsupport CURL::libcurl)
  target_compile_definitions(https_bench PRIVATE ZERITH_COLLECTOR_TOOL="$<TARGET_FILE:zerith-collector>")
  add_dependencies(https_bench zerith-collector)
endif()
