# The dashboard backend's datagrams beside a bare send() loop of the same
# bytes, and the upload backend's 10 MB file upload beside zlib's gzip plus
# libcurl's own POST, against the same loopback servers in the same run.
if(TARGET zerith_testsupport)
  zerith_bench(NAME dashboard_bench SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/DashboardBench.cpp
    DEPS zerith_backends zerith_transport zerith_testsupport CURL::libcurl ZLIB::ZLIB)
endif()
