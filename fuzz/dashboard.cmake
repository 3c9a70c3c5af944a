# The dashboard's readers of network bytes: datagrams and acknowledgements.
# (With ZERITH_FUZZ off, backends_tests replays the corpus.)
zerith_fuzz(NAME dashboard_datagram_fuzz SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/DashboardDatagramFuzz.cpp
  DEPS zerith_backends)
