# Storebag parsers: signed containers and the bags inside them, and the
# Cache-Control value that sets a storebag's max age, and the remembered
# issue times of the daemon's state folder.
zerith_fuzz(NAME storebag_container_fuzz SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/StorebagContainerFuzz.cpp
  DEPS zerith_config)
zerith_fuzz(NAME storebag_cache_control_fuzz SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/StorebagCacheControlFuzz.cpp
  DEPS zerith_config)
zerith_fuzz(NAME storebag_issue_times_fuzz SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/StorebagIssueTimesFuzz.cpp
  DEPS zerith_config)
