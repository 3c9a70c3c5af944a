# The socket's frame codec beside libplist's own parse and write of the same
# event frames.
zerith_bench(NAME frame_codec_bench SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/FrameCodecBench.cpp
             ${CMAKE_CURRENT_SOURCE_DIR}/pipeline/BenchEvent.cpp DEPS zerith_ipc zerith_platform)
