# Storebag verification (a 100 KB signed container) and the agent's cached
# storebag lookup.
zerith_bench(NAME storebag_bench SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/StorebagBench.cpp
  DEPS zerith_daemon zerith_config zerith_platform)
