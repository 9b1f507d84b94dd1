# Installing drd (cmake --install), included from the top CMakeLists.txt. The
# Debian packages (debian/, `./dev package`) are made from the same install.
# Under the prefix:
#
#   bin/drd                                      the daemon
#   lib/systemd/user/drd.socket, drd.service     its systemd user units (for
#                                                /usr and /usr/local; under any
#                                                other prefix, such as ~/.local,
#                                                share/systemd/user, where
#                                                `systemd --user` looks there)
#   share/man/man8/drd.8, share/man/man1/drkit.1 the manual pages (with scdoc)
#   share/bash-completion/completions/drkit      drkit's bash completion
#   share/doc/drd/README.md, share/doc/drd/examples/
#
# The client library, its headers, drd-client.pc and drkit install their own
# files (client/).
include(GNUInstallDirs)

if(TARGET drd)
  install(TARGETS drd RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR} COMPONENT daemon)
endif()

# Empty: chosen from the prefix when installing (see above), since
# `cmake --install --prefix` may choose another prefix than the configured one.
set(DRD_USER_UNIT_DIR ""
    CACHE STRING "Folder of drd's systemd user units, relative to the install prefix")

# drd.service names drd by its installed path, which is known only when
# installing. Each install writes its own copy (installs from one build
# folder may run side by side) and installs that.
install(CODE "
  set(unitdir \"${DRD_USER_UNIT_DIR}\")
  if(unitdir STREQUAL \"\")
    if(CMAKE_INSTALL_PREFIX MATCHES \"^/usr/?$|^/usr/local/?$\")
      set(unitdir lib/systemd/user)
    else()
      set(unitdir share/systemd/user)
    endif()
  endif()
  set(bindir \"${CMAKE_INSTALL_BINDIR}\")
  if(NOT IS_ABSOLUTE \"\${bindir}\")
    set(bindir \"\${CMAKE_INSTALL_PREFIX}/\${bindir}\")
  endif()
  string(RANDOM LENGTH 12 stage)
  set(stage \"${PROJECT_BINARY_DIR}/packaging-stage/\${stage}\")
  configure_file(\"${PROJECT_SOURCE_DIR}/packaging/drd.service.in\" \"\${stage}/drd.service\" @ONLY)
  file(INSTALL DESTINATION \"\${CMAKE_INSTALL_PREFIX}/\${unitdir}\" TYPE FILE
       FILES \"\${stage}/drd.service\" \"${PROJECT_SOURCE_DIR}/packaging/drd.socket\")
  file(REMOVE_RECURSE \"\${stage}\")
" COMPONENT daemon)

install(FILES ${PROJECT_SOURCE_DIR}/README.md DESTINATION ${CMAKE_INSTALL_DOCDIR} COMPONENT daemon)
install(DIRECTORY ${PROJECT_SOURCE_DIR}/examples/ DESTINATION ${CMAKE_INSTALL_DOCDIR}/examples
        USE_SOURCE_PERMISSIONS COMPONENT daemon)

# ---- Manual pages and completion ------------------------------------------------
# Made from drd's and drkit's own command-line tables by drd_docs, so that
# they say what --help says.

add_executable(drd_docs ${PROJECT_SOURCE_DIR}/packaging/docs.cc)
target_link_libraries(drd_docs PRIVATE dr_drkit)
set(docs_dir ${PROJECT_BINARY_DIR}/docs)
add_custom_command(
  OUTPUT ${docs_dir}/drkit
  COMMAND ${CMAKE_COMMAND} -E make_directory ${docs_dir}
  COMMAND drd_docs bash-completion > ${docs_dir}/drkit
  DEPENDS drd_docs
  COMMENT "drkit's bash completion")
set(docs_outputs ${docs_dir}/drkit)

find_program(DRD_SCDOC scdoc)
if(DRD_SCDOC)
  foreach(page drd.8 drkit.1)
    add_custom_command(
      OUTPUT ${docs_dir}/${page}
      COMMAND ${CMAKE_COMMAND} -E make_directory ${docs_dir}
      COMMAND drd_docs ${page}.scd > ${docs_dir}/${page}.scd
      COMMAND ${DRD_SCDOC} < ${docs_dir}/${page}.scd > ${docs_dir}/${page}
      DEPENDS drd_docs
      COMMENT "manual page ${page}")
    list(APPEND docs_outputs ${docs_dir}/${page})
  endforeach()
  install(FILES ${docs_dir}/drd.8 DESTINATION ${CMAKE_INSTALL_MANDIR}/man8 COMPONENT daemon)
  install(FILES ${docs_dir}/drkit.1 DESTINATION ${CMAKE_INSTALL_MANDIR}/man1 COMPONENT client)
else()
  message(STATUS "scdoc not found: the manual pages are not made (./dev deps installs it)")
endif()
add_custom_target(drd_docs_out ALL DEPENDS ${docs_outputs})
install(FILES ${docs_dir}/drkit DESTINATION ${CMAKE_INSTALL_DATADIR}/bash-completion/completions
        COMPONENT client)

# ---- Tests ----------------------------------------------------------------------

if(DRD_BUILD_TESTS)
  add_test(NAME PackagingInstall
           COMMAND sh ${PROJECT_SOURCE_DIR}/tests/packaging/install_test.sh install
                   ${PROJECT_BINARY_DIR})
  set_tests_properties(PackagingInstall PROPERTIES SKIP_RETURN_CODE 77)
endif()
