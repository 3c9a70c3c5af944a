# The socket's parsers: the frame and message decoder on raw bytes, and a
# real connection with the daemon's exporter fed through a socket pair.
# (With ZERITH_FUZZ off, ipc/CMakeLists.txt replays both corpora as tests.)
zerith_fuzz(NAME frame_decoder_fuzz SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/FrameDecoderFuzz.cpp DEPS zerith_ipc)
zerith_fuzz(NAME connection_fuzz SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/ConnectionFuzz.cpp DEPS zerith_ipc)
# The status reply that `zerith status` reads from the daemon.
zerith_fuzz(NAME daemon_status_fuzz SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/DaemonStatusFuzz.cpp DEPS zerith_ipc)
# The frame codec against libplist on the same bytes (differential).
zerith_fuzz(NAME binary_plist_fuzz SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/BinaryPlistFuzz.cpp DEPS zerith_ipc)
# The entitlements policy's files, read as the listener reads them.
zerith_fuzz(NAME entitlement_policy_fuzz SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/EntitlementPolicyFuzz.cpp DEPS zerith_ipc)
# JSON text from callers (payloads, session info, script lines) as values.
zerith_fuzz(NAME json_value_fuzz SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/JsonValueFuzz.cpp DEPS zerith_platform)
