# The target storix::storix. What the library itself uses is its own affair.
include(${CMAKE_CURRENT_LIST_DIR}/storix-targets.cmake)
