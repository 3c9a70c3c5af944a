# Device facts and defaults files: the operator's device file and a defaults
# domain read through their real code paths, and the text files beside them
# (os-release, machine-id, locale settings, message log names).
zerith_fuzz(NAME device_file_fuzz SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/DeviceFileFuzz.cpp
  DEPS zerith_config zerith_backends)
