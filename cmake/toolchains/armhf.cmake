# Cross build for 32-bit ARM, hard float (Debian armhf): scripts/cross.sh armhf.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR armv7l)
set(ZEPA_CROSS_TRIPLET arm-linux-gnueabihf)
set(ZEPA_CROSS_QEMU qemu-arm-static)
set(ZEPA_DEB_ARCHITECTURE armhf)
include(${CMAKE_CURRENT_LIST_DIR}/cross-common.cmake)
