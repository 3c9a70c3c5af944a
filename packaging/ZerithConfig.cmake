# find_package(Zerith) for client programs: the imported target
# Zerith::zerith carries the library and its include folders.
include("${CMAKE_CURRENT_LIST_DIR}/ZerithTargets.cmake")
