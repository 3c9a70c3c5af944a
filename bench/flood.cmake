# The daemon's memory under connections that send calls without reading the
# replies, beside its idle figure. Needs the daemon runner and temporary roots.
if(TARGET zerith_testsupport)
  zerith_bench(NAME flood_bench SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/FloodMemoryBench.cpp
    DEPS zerith zerith_ipc zerith_platform zerith_testsupport)
  add_dependencies(flood_bench zerithd)
  target_compile_definitions(flood_bench PRIVATE ZERITHD_BUILT_BINARY="$<TARGET_FILE:zerithd>")
endif()
