# Cross build for 32-bit ARM Linux (Debian's armhf) with the arm-linux-gnueabihf
# toolchain, against the armhf libraries that multiarch installs on this very
# root (/usr/lib/arm-linux-gnueabihf, headers shared under /usr/include).
# Used by script/test-armhf:
#   cmake -S . -B build-armhf --toolchain cmake/armhf-toolchain.cmake
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR arm)
set(CMAKE_C_COMPILER arm-linux-gnueabihf-gcc)
set(CMAKE_CXX_COMPILER arm-linux-gnueabihf-g++)
set(CMAKE_LIBRARY_ARCHITECTURE arm-linux-gnueabihf)

# Multiarch keeps target and host files in one root: search it for
# libraries, headers and packages (CMake then looks in the armhf library
# directory only), and for programs too, which run on the host.
set(CMAKE_FIND_ROOT_PATH /)
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE ONLY)

# pkg-config must see the armhf .pc files and never the host's.
set(ENV{PKG_CONFIG_LIBDIR} /usr/lib/arm-linux-gnueabihf/pkgconfig:/usr/share/pkgconfig)
set(ENV{PKG_CONFIG_PATH} "")
set(ENV{PKG_CONFIG_SYSROOT_DIR} "")

# Test programs run under qemu-user; the armhf loader
# (/lib/ld-linux-armhf.so.3) and libraries are found from the root.
set(CMAKE_CROSSCOMPILING_EMULATOR /usr/bin/qemu-arm -L /)
