# The transport's one parser of server bytes: response head lines. (With
# ZERITH_FUZZ off, transport_tests replays the corpus.)
zerith_fuzz(NAME response_head_fuzz SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/ResponseHeadFuzz.cpp DEPS zerith_transport)
