# What `cmake --install` lays out, the same tree the Debian packages are cut from:
#   libexec/stowlyd                       the daemon (started by systemd, never by hand)
#   bin/stowlyctl                         the command-line client
#   lib/libstowly.so.0                    the client library, with its headers under
#   include/stowly/                       include/stowly/, stowly.pc and the CMake package
#   lib/cmake/stowly/                     (find_package(stowly) -> stowly::stowly)
#   etc/stowly/                           the default configuration
#   lib/systemd/system/                   the units of packaging/
#   lib/tmpfiles.d/stowlyd.conf           /private/var, which the service may write
#   share/man/                            the man pages (cmake/StowlyMan.cmake)

set(STOWLY_SYSTEMD_UNIT_DIR "lib/systemd/system" CACHE STRING
    "Where the systemd units go, relative to the prefix or absolute")

install(TARGETS stowlyd RUNTIME DESTINATION ${CMAKE_INSTALL_LIBEXECDIR})
install(TARGETS stowlyctl RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR})

install(TARGETS stowly EXPORT stowlyTargets
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR})
# The public headers are STWClient.h and STWUpcallClient.h; the others are what those two
# include. They keep their place in the tree (their includes name it), below include/stowly/;
# the packaging install test compiles each against the installed ones alone.
set(public_headers
  client/STWClient.h
  client/STWUpcallClient.h
  common/STWError.h
  common/STWFileDescriptor.h
  common/STWFormat.h
  common/STWThreadSafety.h
  common/STWValue.h
  platform/STWAuditToken.h
  upcall/STWKernMessages.h
  upcall/STWKernProcessContainers.h)
foreach(header ${public_headers})
  get_filename_component(directory ${header} DIRECTORY)
  install(FILES ${PROJECT_SOURCE_DIR}/${header} DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}/stowly/${directory})
endforeach()

# pkg-config: paths relative to ${prefix} so that a tree installed with --prefix works too.
set(pc_libdir ${CMAKE_INSTALL_LIBDIR})
set(pc_includedir ${CMAKE_INSTALL_INCLUDEDIR})
foreach(var pc_libdir pc_includedir)
  if(NOT IS_ABSOLUTE "${${var}}")
    set(${var} "\${prefix}/${${var}}")
  endif()
endforeach()
configure_file(${PROJECT_SOURCE_DIR}/cmake/stowly.pc.in ${PROJECT_BINARY_DIR}/stowly.pc @ONLY)
install(FILES ${PROJECT_BINARY_DIR}/stowly.pc DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig)

include(CMakePackageConfigHelpers)
set(config_dir ${CMAKE_INSTALL_LIBDIR}/cmake/stowly)
install(EXPORT stowlyTargets NAMESPACE stowly:: DESTINATION ${config_dir})
configure_package_config_file(${PROJECT_SOURCE_DIR}/cmake/stowlyConfig.cmake.in
  ${PROJECT_BINARY_DIR}/stowlyConfig.cmake INSTALL_DESTINATION ${config_dir})
write_basic_package_version_file(${PROJECT_BINARY_DIR}/stowlyConfigVersion.cmake
  COMPATIBILITY SameMajorVersion)
install(FILES ${PROJECT_BINARY_DIR}/stowlyConfig.cmake ${PROJECT_BINARY_DIR}/stowlyConfigVersion.cmake
  DESTINATION ${config_dir})

# The units name the daemon at /usr/libexec/stowlyd; an install elsewhere gets its own path.
foreach(unit stowlyd.service stowlyd.socket stowlyd-upcall.socket)
  file(READ ${PROJECT_SOURCE_DIR}/packaging/${unit} text)
  string(REPLACE "/usr/libexec/stowlyd" "${CMAKE_INSTALL_FULL_LIBEXECDIR}/stowlyd" text "${text}")
  file(GENERATE OUTPUT ${PROJECT_BINARY_DIR}/packaging/${unit} CONTENT "${text}")
  install(FILES ${PROJECT_BINARY_DIR}/packaging/${unit} DESTINATION ${STOWLY_SYSTEMD_UNIT_DIR})
endforeach()
install(FILES ${PROJECT_SOURCE_DIR}/packaging/stowlyd.tmpfiles DESTINATION lib/tmpfiles.d
  RENAME stowlyd.conf)
set_property(DIRECTORY APPEND PROPERTY CMAKE_CONFIGURE_DEPENDS
  ${PROJECT_SOURCE_DIR}/packaging/stowlyd.service ${PROJECT_SOURCE_DIR}/packaging/stowlyd.socket
  ${PROJECT_SOURCE_DIR}/packaging/stowlyd-upcall.socket)

# The configuration directory the daemon reads (below its root prefix): a stowlyd.plist that
# sets nothing (every key at its default) and the empty client registry.
install(FILES ${PROJECT_SOURCE_DIR}/packaging/stowlyd.plist DESTINATION ${CMAKE_INSTALL_SYSCONFDIR}/stowly)
install(DIRECTORY DESTINATION ${CMAKE_INSTALL_SYSCONFDIR}/stowly/clients.d)
