# Builds for arm64 on another Debian machine: with g++-aarch64-linux-gnu and the libraries of arm64,
# installed beside the machine's own (dpkg --add-architecture arm64).
#
#   cmake -S . -B build/arm64 --toolchain cmake/aarch64-linux-gnu.cmake -DTESSEL_BUILD_BENCH=OFF
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR aarch64)
set(CMAKE_C_COMPILER aarch64-linux-gnu-gcc)
set(CMAKE_CXX_COMPILER aarch64-linux-gnu-g++)
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
# pkg-config would find the libraries of this machine first.
set(ENV{PKG_CONFIG_LIBDIR} /usr/lib/aarch64-linux-gnu/pkgconfig:/usr/share/pkgconfig)
