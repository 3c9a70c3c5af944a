# Compression of a 20 KB JSON envelope beside zlib's own minigzip-style loop,
# and the message log's append rate with 1 and with 100 files in its folder.
zerith_bench(NAME config_bench
  SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/ConfigCompressionBench.cpp ${CMAKE_CURRENT_SOURCE_DIR}/ConfigMessageLogBench.cpp
  DEPS zerith_config zerith_platform ZLIB::ZLIB benchmark::benchmark_main)
