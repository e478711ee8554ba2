# What arm64.cmake and armhf.cmake share. The target's libraries come from a
# sysroot of the target's Debian packages (scripts/cross.sh makes it): it never
# touches the build machine's own packages, so it needs no version match with
# them. Pass it as -DZEPA_CROSS_SYSROOT=DIR or in the environment.
if(NOT ZEPA_CROSS_SYSROOT AND DEFINED ENV{ZEPA_CROSS_SYSROOT})
  set(ZEPA_CROSS_SYSROOT "$ENV{ZEPA_CROSS_SYSROOT}")
endif()
if(NOT ZEPA_CROSS_SYSROOT OR NOT IS_DIRECTORY "${ZEPA_CROSS_SYSROOT}/usr/lib/${ZEPA_CROSS_TRIPLET}")
  message(FATAL_ERROR "No sysroot of ${ZEPA_CROSS_TRIPLET} libraries at '${ZEPA_CROSS_SYSROOT}': "
                      "run scripts/cross.sh, which makes one, or pass -DZEPA_CROSS_SYSROOT=DIR")
endif()
# try_compile projects read this file again and need the sysroot too.
list(APPEND CMAKE_TRY_COMPILE_PLATFORM_VARIABLES ZEPA_CROSS_SYSROOT)

set(CMAKE_C_COMPILER ${ZEPA_CROSS_TRIPLET}-gcc)
set(CMAKE_CXX_COMPILER ${ZEPA_CROSS_TRIPLET}-g++)
set(CMAKE_LIBRARY_ARCHITECTURE ${ZEPA_CROSS_TRIPLET})

# Debian's multiarch library folder, as GNUInstallDirs picks it for native
# builds only.
if(NOT DEFINED CMAKE_INSTALL_LIBDIR)
  set(CMAKE_INSTALL_LIBDIR "lib/${ZEPA_CROSS_TRIPLET}" CACHE PATH "Object code libraries (lib/<triplet>)")
endif()

# Headers and libraries from the sysroot only; programs (python3, openssl) from
# the build machine.
set(CMAKE_FIND_ROOT_PATH "${ZEPA_CROSS_SYSROOT}")
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE ONLY)
set(ENV{PKG_CONFIG_LIBDIR}
    "${ZEPA_CROSS_SYSROOT}/usr/lib/${ZEPA_CROSS_TRIPLET}/pkgconfig:${ZEPA_CROSS_SYSROOT}/usr/share/pkgconfig")
set(ENV{PKG_CONFIG_SYSROOT_DIR} "${ZEPA_CROSS_SYSROOT}")
set(ENV{PKG_CONFIG_PATH} "")

# Debian keeps some target headers in the multiarch folder (opensslconf.h,
# curl); a native compiler searches it by itself.
foreach(_zepa_lang C CXX)
  set(CMAKE_${_zepa_lang}_STANDARD_INCLUDE_DIRECTORIES
      "${ZEPA_CROSS_SYSROOT}/usr/include/${ZEPA_CROSS_TRIPLET}" "${ZEPA_CROSS_SYSROOT}/usr/include")
endforeach()

# The compiler brings its own C library; the linker finds the dependencies of
# the sysroot's libraries (libcurl's libssl, ...) through rpath-link.
set(_zepa_rpath_link
    "-Wl,-rpath-link,${ZEPA_CROSS_SYSROOT}/usr/lib/${ZEPA_CROSS_TRIPLET}:${ZEPA_CROSS_SYSROOT}/lib/${ZEPA_CROSS_TRIPLET}")
set(CMAKE_EXE_LINKER_FLAGS_INIT "${_zepa_rpath_link}")
set(CMAKE_SHARED_LINKER_FLAGS_INIT "${_zepa_rpath_link}")
set(CMAKE_MODULE_LINKER_FLAGS_INIT "${_zepa_rpath_link}")

# Tests run under qemu-user with the sysroot as the target's root for the
# loader and libraries. Programs that the tests start themselves reach qemu
# through binfmt_misc, which reads the same root from QEMU_LD_PREFIX.
set(CMAKE_CROSSCOMPILING_EMULATOR /usr/bin/env "QEMU_LD_PREFIX=${ZEPA_CROSS_SYSROOT}" ${ZEPA_CROSS_QEMU})
