# The spool's reader of files found in its folder: header, checksum, bounded
# fields, and the store's index-and-read path. (With ZERITH_FUZZ off,
# backends_tests replays the corpus.)
zerith_fuzz(NAME spool_file_fuzz SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/SpoolFileFuzz.cpp DEPS zerith_backends)
