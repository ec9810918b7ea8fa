# Cross build for 64-bit ARM Linux with Debian's cross compiler, against the arm64 packages of
# the dependencies installed next to the host's own (multiarch: headers in /usr/include, arm64
# libraries in /usr/lib/aarch64-linux-gnu). Programs built here run on the build host through
# qemu-user, which is also what CTest and GoogleTest's test discovery use to start them.
#
#   cmake -S . -B build-aarch64 -DCMAKE_TOOLCHAIN_FILE=cmake/aarch64-linux-gnu.cmake
#
# scripts/test-aarch64.sh installs what this needs.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR aarch64)

set(CMAKE_C_COMPILER aarch64-linux-gnu-gcc)
set(CMAKE_CXX_COMPILER aarch64-linux-gnu-g++)
# The arm64 multiarch directories: every library search looks in /usr/lib/aarch64-linux-gnu
# (and the Android libraries in its android/ subdirectory), never in the host's
# /usr/lib/x86_64-linux-gnu.
set(CMAKE_LIBRARY_ARCHITECTURE aarch64-linux-gnu)

set(CMAKE_CROSSCOMPILING_EMULATOR /usr/bin/qemu-aarch64-static)
