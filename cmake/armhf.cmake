# Toolchain for the appliance: ARMv7-A with hardware floating point. The cross compiler is Debian's.
# scripts/bootstrap armhf unpacks the libraries for this processor into the sysroot.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR armv7l)
set(CMAKE_LIBRARY_ARCHITECTURE arm-linux-gnueabihf)
set(CMAKE_CXX_COMPILER arm-linux-gnueabihf-g++)
# GCC 7 changed how some parameters are passed. No code here was compiled before.
set(CMAKE_CXX_FLAGS_INIT -Wno-psabi)

cmake_path(GET CMAKE_CURRENT_LIST_DIR PARENT_PATH TESSEL_ROOT)
set(CMAKE_FIND_ROOT_PATH ${TESSEL_ROOT}/build/armhf-sysroot)
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
# Search the host too: an installed build of this project may be outside the sysroot.
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE BOTH)

# The end-to-end tests read this from the cache.
set(CMAKE_CROSSCOMPILING_EMULATOR ${TESSEL_ROOT}/tools/run-armhf CACHE FILEPATH "")
