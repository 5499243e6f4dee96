# Cross build for the unit; the results run here under QEMU's user emulation.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR armv7l)
set(CMAKE_C_COMPILER arm-linux-gnueabihf-gcc-11) # googletest requires one
set(CMAKE_CXX_COMPILER arm-linux-gnueabihf-g++-11)
set(CMAKE_LIBRARY_ARCHITECTURE arm-linux-gnueabihf)
find_program(QEMU_ARM qemu-arm-static REQUIRED)
set(CMAKE_CROSSCOMPILING_EMULATOR ${QEMU_ARM} -L /usr/arm-linux-gnueabihf)
# Libraries of the companion program, when packaging/armhf-libraries has fetched them.
set(CMAKE_FIND_ROOT_PATH ${CMAKE_CURRENT_LIST_DIR}/../build/armhf-libraries)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
