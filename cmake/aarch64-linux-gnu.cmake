# Cross builds for 64-bit ARM (Debian's arm64).
set(CMAKE_SYSTEM_PROCESSOR aarch64)
set(VEX_TRIPLET aarch64-linux-gnu)
set(VEX_EMULATOR qemu-aarch64-static)
include(${CMAKE_CURRENT_LIST_DIR}/foreign.cmake)
