# Install rules (GNUInstallDirs), the pkg-config file, the CMake package
# config and the Debian package made by CPack (`make package`).
include(CMakePackageConfigHelpers)

set(KLP_PROGRAMS klpkccmd klptrc klptrcbp klpkcap)
install(TARGETS ${KLP_PROGRAMS} RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR})
install(TARGETS klp EXPORT klpTargets
        LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR}
        INCLUDES DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}/klp)
install(FILES ${CMAKE_SOURCE_DIR}/include/klpapi.h ${CMAKE_SOURCE_DIR}/include/klptrc.h
        DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}/klp)
# Where the catalogue reader looks as the data directory (docs/catalogue.md).
install(FILES ${KLP_CATALOG_MO} DESTINATION ${CMAKE_INSTALL_DATADIR}/klp)

foreach(page ${KLP_MAN_PAGES})
  string(REGEX REPLACE ".*\\." "" section ${page})
  install(FILES ${CMAKE_BINARY_DIR}/man/${page} DESTINATION ${CMAKE_INSTALL_MANDIR}/man${section})
endforeach()
foreach(prog ${KLP_COMPLETIONS})
  install(FILES ${CMAKE_BINARY_DIR}/completion/${prog}
          DESTINATION ${CMAKE_INSTALL_DATADIR}/bash-completion/completions)
endforeach()

# pkg-config: the prefix is found from where the file lies, so that a tree
# installed under another prefix (or staged for the package) is still right.
file(RELATIVE_PATH KLP_PC_TO_PREFIX ${CMAKE_INSTALL_FULL_LIBDIR}/pkgconfig ${CMAKE_INSTALL_PREFIX})
file(RELATIVE_PATH KLP_PC_LIBDIR ${CMAKE_INSTALL_PREFIX} ${CMAKE_INSTALL_FULL_LIBDIR})
file(RELATIVE_PATH KLP_PC_INCLUDEDIR ${CMAKE_INSTALL_PREFIX} ${CMAKE_INSTALL_FULL_INCLUDEDIR})
string(REGEX REPLACE "/$" "" KLP_PC_TO_PREFIX "${KLP_PC_TO_PREFIX}")
configure_file(${CMAKE_SOURCE_DIR}/cmake/klp.pc.in ${CMAKE_BINARY_DIR}/klp.pc @ONLY)
install(FILES ${CMAKE_BINARY_DIR}/klp.pc DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig)

# find_package(klp) gives the imported target klp::klp.
set(KLP_CMAKE_DIR ${CMAKE_INSTALL_LIBDIR}/cmake/klp)
install(EXPORT klpTargets NAMESPACE klp:: DESTINATION ${KLP_CMAKE_DIR})
configure_package_config_file(${CMAKE_SOURCE_DIR}/cmake/klpConfig.cmake.in
  ${CMAKE_BINARY_DIR}/klpConfig.cmake INSTALL_DESTINATION ${KLP_CMAKE_DIR})
write_basic_package_version_file(${CMAKE_BINARY_DIR}/klpConfigVersion.cmake
  COMPATIBILITY SameMajorVersion)
install(FILES ${CMAKE_BINARY_DIR}/klpConfig.cmake ${CMAKE_BINARY_DIR}/klpConfigVersion.cmake
        DESTINATION ${KLP_CMAKE_DIR})

# The Debian package. Its dependencies are what dpkg-shlibdeps finds the
# installed objects need: ICU only because libklp.so links it.
set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME klp)
set(CPACK_PACKAGE_VENDOR "klp project")
set(CPACK_PACKAGE_CONTACT "klp maintainers <klp@localhost>")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "operator tools for K Capture change-data-capture servers")
set(CPACK_PACKAGE_DESCRIPTION
    "klpkccmd commands a running K Capture server, klptrc controls and formats its trace, klpkcap is a sample server; libklp exports the C control interface.")
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SECTION admin)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS ON)
set(CPACK_STRIP_FILES ON)
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
include(CPack)

# The install tests (tests/install/) install this build, package it, and
# build a program against the result.
if(TARGET test_tests_install)
  set(KLP_SANITIZE_FLAGS "")
  if(KLP_SANITIZE)
    set(KLP_SANITIZE_FLAGS "-fsanitize=${KLP_SANITIZE}")
  endif()
  find_program(KLP_UNSHARE unshare REQUIRED)
  find_program(KLP_BASH bash REQUIRED)
  target_compile_definitions(test_tests_install PRIVATE
    KLP_UNSHARE="${KLP_UNSHARE}" KLP_BASH="${KLP_BASH}"
    KLP_BUILD_DIR="${CMAKE_BINARY_DIR}" KLP_CMAKE="${CMAKE_COMMAND}"
    KLP_CPACK="${CMAKE_CPACK_COMMAND}" KLP_CC="${CMAKE_C_COMPILER}"
    KLP_SANITIZE_FLAGS="${KLP_SANITIZE_FLAGS}" KLP_LIBDIR="${CMAKE_INSTALL_LIBDIR}")
  add_dependencies(test_tests_install klp_docs klp ${KLP_PROGRAMS})
endif()
