# Install rules and the Debian packages (CPack DEB):
#   vesseld        the daemon, vesselctl, the units, the tmpfiles entry, the man pages and
#                  an example /etc/vesseld
#   libvessel-dev  the client library (static), its headers and pkg-config file
# Build them from a release configuration:
#   cmake -S . -B build-release -G Ninja && cmake --build build-release --target package
# A VESSEL_KILLPOINTS build packages too (its tests check the packages), marked
# "~killpoints" in its version so that it is never taken for a release.
#
# The packages install under /usr (the units name /usr/sbin/vesseld), whatever
# CMAKE_INSTALL_PREFIX says; the directories below are relative to the prefix.
include(GNUInstallDirs)

set(VESSEL_VERSION 0.1.0)
set(VESSEL_LIBDIR lib)
if(CMAKE_LIBRARY_ARCHITECTURE)
  set(VESSEL_LIBDIR lib/${CMAKE_LIBRARY_ARCHITECTURE})
endif()

# The client library as one archive, with the platform layer and packbuff it needs.
set(vessel_objects $<TARGET_OBJECTS:vessel_client> $<TARGET_OBJECTS:vessel_platform>)
if(TARGET packbuff)
  list(APPEND vessel_objects $<TARGET_OBJECTS:packbuff>)
endif()
add_library(vessel STATIC ${vessel_objects})
set_target_properties(vessel PROPERTIES LINKER_LANGUAGE CXX)
# From <prefix>/<libdir>/pkgconfig back up to the prefix.
string(REGEX REPLACE "[^/]+" ".." VESSEL_PC_PREFIX_FROM_PCFILEDIR "${VESSEL_LIBDIR}/pkgconfig")
configure_file(${CMAKE_SOURCE_DIR}/packaging/vessel.pc.in ${CMAKE_BINARY_DIR}/vessel.pc @ONLY)

# ---- vesseld ----
install(TARGETS vesseld RUNTIME DESTINATION sbin COMPONENT daemon)
install(TARGETS vesselctl RUNTIME DESTINATION bin COMPONENT daemon)
install(FILES packaging/vesseld.service packaging/vesseld.socket packaging/vesseld-upcall.socket
  DESTINATION lib/systemd/system COMPONENT daemon)
install(FILES packaging/vesseld.tmpfiles DESTINATION lib/tmpfiles.d RENAME vesseld.conf COMPONENT daemon)
# The daemon reads etc/vesseld below its root, which is / for the service: always /etc.
install(FILES packaging/etc/device.plist DESTINATION /etc/vesseld COMPONENT daemon)
install(DIRECTORY DESTINATION /etc/vesseld/code-signatures COMPONENT daemon)
install(FILES packaging/examples/vesselctl.plist packaging/examples/personas.plist
  DESTINATION share/doc/vesseld/examples COMPONENT daemon)
install(FILES docs/operations.md docs/protocol.md DESTINATION share/doc/vesseld COMPONENT daemon)

# ---- libvessel-dev ----
install(TARGETS vessel ARCHIVE DESTINATION ${VESSEL_LIBDIR} COMPONENT dev)
# The archive keeps no debug sections: ten times smaller, and quick to pack.
install(CODE "execute_process(COMMAND ${CMAKE_STRIP} --strip-debug
  \"\$ENV{DESTDIR}\${CMAKE_INSTALL_PREFIX}/${VESSEL_LIBDIR}/libvessel.a\")" COMPONENT dev)
install(FILES ${CMAKE_BINARY_DIR}/vessel.pc DESTINATION ${VESSEL_LIBDIR}/pkgconfig COMPONENT dev)
foreach(dir Client Platform packbuff)
  install(DIRECTORY src/${dir}/ DESTINATION include/vessel/${dir} COMPONENT dev
    FILES_MATCHING PATTERN "*.h" PATTERN "*.hpp")
endforeach()

# ---- packages ----
set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME vesseld)
set(CPACK_PACKAGE_VENDOR "vesseld maintainers")
set(CPACK_PACKAGE_CONTACT "vesseld maintainers <root@localhost>")
set(CPACK_PACKAGE_VERSION ${VESSEL_VERSION})
if(VESSEL_KILLPOINTS)
  set(CPACK_PACKAGE_VERSION "${VESSEL_VERSION}~killpoints")
endif()
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_STRIP_FILES ON)
set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_COMPONENTS_ALL daemon dev)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)

set(CPACK_DEBIAN_DAEMON_PACKAGE_NAME vesseld)
set(CPACK_DEBIAN_DAEMON_PACKAGE_SECTION admin)
set(CPACK_DEBIAN_DAEMON_PACKAGE_SHLIBDEPS ON)
set(CPACK_COMPONENT_DAEMON_DESCRIPTION "container-directory daemon
 vesseld owns the directories in which applications, plug-ins, application groups,
 system services and the system keep their code and data, and serves clients over a
 local socket; vesselctl speaks its protocol from the command line.")
set(vessel_conffiles ${CMAKE_BINARY_DIR}/packaging/conffiles)
file(WRITE ${vessel_conffiles} "/etc/vesseld/device.plist\n")
set(CPACK_DEBIAN_DAEMON_PACKAGE_CONTROL_EXTRA ${vessel_conffiles} ${CMAKE_SOURCE_DIR}/packaging/deb/postinst
  ${CMAKE_SOURCE_DIR}/packaging/deb/prerm ${CMAKE_SOURCE_DIR}/packaging/deb/postrm)
set(CPACK_DEBIAN_DAEMON_PACKAGE_CONTROL_STRICT_PERMISSION ON)

set(CPACK_DEBIAN_DEV_PACKAGE_NAME libvessel-dev)
set(CPACK_DEBIAN_DEV_PACKAGE_SECTION libdevel)
set(CPACK_DEBIAN_DEV_PACKAGE_DEPENDS "libplist-dev, uuid-dev, libacl1-dev")
set(CPACK_COMPONENT_DEV_DESCRIPTION "client library of vesseld (development files)
 libvessel sends requests to vesseld and reads its replies; a static library with its
 headers and a pkg-config file (vessel).")

include(CPack)
