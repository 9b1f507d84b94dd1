# Installing drd (cmake --install) and its Debian package (cpack), included
# from the top CMakeLists.txt. Under the prefix:
#
#   bin/drd                                      the daemon
#   lib/systemd/user/drd.socket, drd.service     its systemd user units
#   share/doc/drd/README.md, share/doc/drd/examples/
#
# These are the "daemon" component. The client library, its headers,
# drd-client.pc and drkit install their own files (client/); the one package
# takes every component the project installs.
include(GNUInstallDirs)

if(TARGET drd)
  install(TARGETS drd RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR} COMPONENT daemon)
endif()

# Relative to the prefix, so that /usr and /usr/local both land in folders
# systemd searches for user units.
set(DRD_SYSTEMD_USER_UNIT_DIR "lib/systemd/user"
    CACHE STRING "Folder of drd's systemd user units, relative to the install prefix")

install(FILES ${PROJECT_SOURCE_DIR}/packaging/drd.socket DESTINATION ${DRD_SYSTEMD_USER_UNIT_DIR}
        COMPONENT daemon)

# drd.service names drd by its installed path, which is known only when
# installing: `cmake --install --prefix` and cpack choose the prefix then, not
# at configure time. Each install writes its own copy (installs from one build
# folder may run side by side) and installs that.
install(CODE "
  set(bindir \"${CMAKE_INSTALL_BINDIR}\")
  if(NOT IS_ABSOLUTE \"\${bindir}\")
    set(bindir \"\${CMAKE_INSTALL_PREFIX}/\${bindir}\")
  endif()
  string(RANDOM LENGTH 12 stage)
  set(stage \"${PROJECT_BINARY_DIR}/packaging-stage/\${stage}\")
  configure_file(\"${PROJECT_SOURCE_DIR}/packaging/drd.service.in\" \"\${stage}/drd.service\" @ONLY)
  file(INSTALL DESTINATION \"\${CMAKE_INSTALL_PREFIX}/${DRD_SYSTEMD_USER_UNIT_DIR}\"
       TYPE FILE FILES \"\${stage}/drd.service\")
  file(REMOVE_RECURSE \"\${stage}\")
" COMPONENT daemon)

install(FILES ${PROJECT_SOURCE_DIR}/README.md DESTINATION ${CMAKE_INSTALL_DOCDIR} COMPONENT daemon)
install(DIRECTORY ${PROJECT_SOURCE_DIR}/examples/ DESTINATION ${CMAKE_INSTALL_DOCDIR}/examples
        USE_SOURCE_PERMISSIONS COMPONENT daemon)

# ---- Debian package -----------------------------------------------------------

set(DRD_PACKAGE_MAINTAINER "drd developers <drd@example.org>"
    CACHE STRING "Maintainer field of the Debian package")

set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME drd)
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGE_CONTACT ${DRD_PACKAGE_MAINTAINER})
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "per-user plug-in registry daemon")
set(CPACK_PACKAGE_DESCRIPTION
    "drd keeps the registry of a user's installed plug-ins (bundles on disk with an
information dictionary) and lets host applications discover, ready and annotate
them over a local socket. It runs per user, started by systemd socket activation.")
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_STRIP_FILES ON)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)  # drd_<version>_<arch>.deb
set(CPACK_DEBIAN_PACKAGE_SECTION misc)
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)
# Type conformance reads the shared MIME database.
set(CPACK_DEBIAN_PACKAGE_RECOMMENDS "systemd, shared-mime-info")
set(CPACK_DEBIAN_PACKAGE_CONTROL_EXTRA ${PROJECT_SOURCE_DIR}/packaging/postinst
                                       ${PROJECT_SOURCE_DIR}/packaging/prerm)
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)

# The runtime libraries come from the binaries themselves when Debian's tools
# are there to read them; otherwise from the list drd links against today.
find_program(DRD_DPKG_SHLIBDEPS dpkg-shlibdeps)
find_program(DRD_FILE_PROGRAM file)
if(DRD_DPKG_SHLIBDEPS AND DRD_FILE_PROGRAM)
  set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
  # The client library's SONAME, and the ldconfig trigger that comes with it.
  set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS ON)
else()
  set(CPACK_DEBIAN_PACKAGE_DEPENDS
      "libc6, libstdc++6, libgcc-s1, libexpat1, libsqlite3-0, libsodium23, libicu72, libsystemd0")
endif()

include(CPack)

# ---- Tests ----------------------------------------------------------------------

if(DRD_BUILD_TESTS)
  add_test(NAME PackagingInstall
           COMMAND sh ${PROJECT_SOURCE_DIR}/tests/packaging/install_test.sh install
                   ${PROJECT_BINARY_DIR})
  add_test(NAME PackagingDebian
           COMMAND sh ${PROJECT_SOURCE_DIR}/tests/packaging/install_test.sh debian
                   ${PROJECT_BINARY_DIR})
  set_tests_properties(PackagingInstall PackagingDebian PROPERTIES SKIP_RETURN_CODE 77)
endif()
