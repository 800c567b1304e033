# Builds the 32-bit x86 form on an x86-64 Debian host:
#   cmake -S . -B build/i386 --toolchain cmake/i386-linux-gnu.cmake
# It needs g++-multilib and the i386 packages of the libraries
# (dpkg --add-architecture i386; apt-get install liblog4cxx-dev:i386
# libgtest-dev:i386 libgmock-dev:i386); scripts/test.sh --i386 does both.
# The host runs the binaries, so the tests run as usual.
set(CMAKE_C_FLAGS_INIT -m32)
set(CMAKE_CXX_FLAGS_INIT -m32)
set(CMAKE_EXE_LINKER_FLAGS_INIT -m32)
set(CMAKE_SHARED_LINKER_FLAGS_INIT -m32)
set(CMAKE_MODULE_LINKER_FLAGS_INIT -m32)
# Where Debian puts the i386 libraries and their CMake and pkg-config files.
set(CMAKE_LIBRARY_ARCHITECTURE i386-linux-gnu)
set(ENV{PKG_CONFIG_LIBDIR} /usr/lib/i386-linux-gnu/pkgconfig:/usr/share/pkgconfig)
