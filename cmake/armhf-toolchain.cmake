# Cross build for the phone's processor: 32-bit ARM, hard float, with Debian's
# arm-linux-gnueabihf compiler and the armhf packages installed beside the
# host's (tools/install-deps.sh --arm). The programs run under qemu through
# binfmt_misc, so the tests run them as they are.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR arm)
set(CMAKE_LIBRARY_ARCHITECTURE arm-linux-gnueabihf)
set(CMAKE_C_COMPILER arm-linux-gnueabihf-gcc)
set(CMAKE_CXX_COMPILER arm-linux-gnueabihf-g++)

# Debian's multiarch layout has no sysroot: armhf libraries, CMake packages and
# pkg-config files live under /usr/lib/arm-linux-gnueabihf, the headers that
# differ under /usr/include/arm-linux-gnueabihf. Host programs stay usable.
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(ENV{PKG_CONFIG_LIBDIR} "/usr/lib/arm-linux-gnueabihf/pkgconfig:/usr/share/pkgconfig")
set(ENV{PKG_CONFIG_PATH} "")
