# Cross build for 64-bit ARM (Debian arm64): scripts/cross.sh arm64.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR aarch64)
set(ZEPA_CROSS_TRIPLET aarch64-linux-gnu)
set(ZEPA_CROSS_QEMU qemu-aarch64-static)
set(ZEPA_DEB_ARCHITECTURE arm64)
include(${CMAKE_CURRENT_LIST_DIR}/cross-common.cmake)
