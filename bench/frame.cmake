# The frame codec beside libplist's own writer on the same messages.
zerith_bench(NAME frame_bench SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/FrameCodecBench.cpp
  DEPS zerith_ipc zerith_platform PkgConfig::PLIST)
