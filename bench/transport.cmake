# The connectivity helper against the in-process HTTPS server on loopback:
# request round trips (fresh and kept-alive connections, data and upload
# POSTs), many requests in flight, and a large answer. Needs the test support
# library (the HTTPS server, the test CA, temporary roots).
if(TARGET zerith_testsupport)
  zerith_bench(NAME transport_bench SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/TransportBench.cpp
    DEPS zerith_transport zerith_testsupport)
endif()
