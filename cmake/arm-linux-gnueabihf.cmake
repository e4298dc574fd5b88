# Cross builds for 32-bit ARM, as most routers are (Debian's armhf).
set(CMAKE_SYSTEM_PROCESSOR armv7l)
set(VEX_TRIPLET arm-linux-gnueabihf)
set(VEX_EMULATOR qemu-arm-static)
include(${CMAKE_CURRENT_LIST_DIR}/foreign.cmake)
