# Cross build for aarch64 with Debian's cross compiler, against Debian's
# arm64 packages installed through multiarch (scripts/deps.sh aarch64):
# headers in /usr/include, libraries in /usr/lib/aarch64-linux-gnu.
# Target programs (tests, test discovery, the man page) run under
# qemu-aarch64 with the cross compiler's sysroot as its prefix (-L is
# QEMU_LD_PREFIX): the loader, libc and libstdc++ come from there, as the
# compiler linked them, and the other libraries from multiarch.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR aarch64)
set(CMAKE_LIBRARY_ARCHITECTURE aarch64-linux-gnu)
set(CMAKE_C_COMPILER aarch64-linux-gnu-gcc)
set(CMAKE_CXX_COMPILER aarch64-linux-gnu-g++)

set(KM_AARCH64_SYSROOT /usr/aarch64-linux-gnu)
set(CMAKE_CROSSCOMPILING_EMULATOR qemu-aarch64 -L ${KM_AARCH64_SYSROOT} -E LD_LIBRARY_PATH=${KM_AARCH64_SYSROOT}/lib)

# Packages of the target: CMake looks in lib/aarch64-linux-gnu, pkg-config
# (OpenSSL's hints) in the arm64 directories only.
set(ENV{PKG_CONFIG_LIBDIR} /usr/lib/${CMAKE_LIBRARY_ARCHITECTURE}/pkgconfig:/usr/share/pkgconfig)

# help2man runs kmctl to read its --help and --version: under the emulator.
set(HELP2MAN bash ${CMAKE_CURRENT_LIST_DIR}/help2man_emulated.sh ${CMAKE_CROSSCOMPILING_EMULATOR} --
    CACHE STRING "help2man running its program under the emulator")
