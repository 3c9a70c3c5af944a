# The HTTPS backend's batch writer against the nlohmann tree it replaced, on
# records read from binary property lists. (With ZERITH_FUZZ off,
# backends_tests replays the corpus.)
zerith_fuzz(NAME record_json_fuzz SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/RecordJsonFuzz.cpp DEPS zerith_backends)
