# Builds for 64-bit ARM on a machine of another kind, with Debian's cross compiler; the presets arm64 use it.
# Expects what scripts/install-deps arm64 installs. Promises: what an arm64 machine's own build puts where.
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR aarch64)
set(szTriplet aarch64-linux-gnu)
set(CMAKE_C_COMPILER ${szTriplet}-gcc)
set(CMAKE_CXX_COMPILER ${szTriplet}-g++)
set(PKG_CONFIG_EXECUTABLE ${szTriplet}-pkg-config CACHE FILEPATH "Finds the libraries of the machine built for")
# CMake's and CPack's own choices are those of the machine that builds.
set(CMAKE_INSTALL_LIBDIR lib/${szTriplet} CACHE PATH "Where libraries go")
set(CPACK_DEBIAN_PACKAGE_ARCHITECTURE arm64)

# The tool writes its completions itself, and the tests run. Elsewhere than at / the emulator would look first for
# the libraries of the cross compiler, which are not all.
find_program(QEMU_AARCH64 NAMES qemu-aarch64 qemu-aarch64-static)
if(QEMU_AARCH64)
  set(CMAKE_CROSSCOMPILING_EMULATOR ${QEMU_AARCH64} -L /)
endif()
