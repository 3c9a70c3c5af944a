# The collector's decoding of untrusted bodies: size caps, bounded gzip
# inflation, the JSON depth scan and the envelope parse. (With ZERITH_FUZZ
# off, zerith_collector_tests replays the corpus.)
zerith_fuzz(NAME collector_body_fuzz SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/CollectorBodyFuzz.cpp DEPS zerith_collector)
