# The Debian package: `cpack -G DEB` in a build tree configured with the /usr prefix
# (the default), for example build/release.
set(VIREO_PACKAGE_MAINTAINER "Vireo Maintainers <vireo-maintainers@orvane.example>")
set(VIREO_PACKAGE_RELEASE 1)
set(VIREO_PACKAGE_DIR ${CMAKE_CURRENT_LIST_DIR})
set(VIREO_PACKAGE_BINARY_DIR ${PROJECT_BINARY_DIR}/packaging)

if(NOT CMAKE_INSTALL_PREFIX STREQUAL "/usr")
  message(WARNING "The Debian package installs to /usr, but this tree is configured for "
                  "${CMAKE_INSTALL_PREFIX}: the units and bus files would name the wrong paths. "
                  "Configure with -DCMAKE_INSTALL_PREFIX=/usr to build the package.")
endif()

# Files of /usr/share/doc/vireo that the Debian tools look for.
configure_file(${VIREO_PACKAGE_DIR}/changelog.in ${VIREO_PACKAGE_BINARY_DIR}/changelog @ONLY)
find_program(VIREO_GZIP gzip REQUIRED)
add_custom_command(OUTPUT ${VIREO_PACKAGE_BINARY_DIR}/changelog.Debian.gz
  COMMAND ${VIREO_GZIP} -9nc ${VIREO_PACKAGE_BINARY_DIR}/changelog > ${VIREO_PACKAGE_BINARY_DIR}/changelog.Debian.gz
  DEPENDS ${VIREO_PACKAGE_BINARY_DIR}/changelog
  VERBATIM)
add_custom_target(vireo_package_docs ALL DEPENDS ${VIREO_PACKAGE_BINARY_DIR}/changelog.Debian.gz)
install(FILES ${VIREO_PACKAGE_DIR}/copyright ${VIREO_PACKAGE_BINARY_DIR}/changelog.Debian.gz
              ${PROJECT_SOURCE_DIR}/docs/integrators-guide.md
        DESTINATION ${CMAKE_INSTALL_DOCDIR})
install(FILES ${VIREO_PACKAGE_DIR}/lintian-overrides DESTINATION ${CMAKE_INSTALL_DATADIR}/lintian/overrides
        RENAME vireo)

# Maintainer scripts, with the paths of this build.
foreach(script postinst prerm postrm)
  configure_file(${VIREO_PACKAGE_DIR}/${script}.in ${VIREO_PACKAGE_BINARY_DIR}/control/${script} @ONLY
                 FILE_PERMISSIONS OWNER_READ OWNER_WRITE OWNER_EXECUTE GROUP_READ GROUP_EXECUTE
                                  WORLD_READ WORLD_EXECUTE)
endforeach()

set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME vireo)
set(CPACK_PACKAGE_VENDOR "Orvane")
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGE_CONTACT "${VIREO_PACKAGE_MAINTAINER}")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "reporting service of the audio stack")
set(CPACK_PACKAGE_DESCRIPTION
"Vireo collects what the audio clients of a device report about their
playback, recording and telephony sessions. Clients drive reporting
sessions over D-Bus; the daemon numbers and aggregates their messages,
keeps them in a local SQLite store, reports the growth of the audio
drivers' counters over each session and summarises each session when
it stops.
.
This package holds the daemon vireo-reportingd with its systemd unit,
D-Bus policy and activation files, the command-line client vireoctl
and the C++ client library with its pkg-config and CMake files.")
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_STRIP_FILES ON)

set(CPACK_DEBIAN_PACKAGE_RELEASE ${VIREO_PACKAGE_RELEASE})
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SECTION sound)
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS ON)
# Libraries of this package that its own programs link.
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS_PRIVATE_DIRS usr/${CMAKE_INSTALL_LIBDIR})
set(CPACK_DEBIAN_COMPRESSION_TYPE xz)
set(CPACK_DEBIAN_PACKAGE_CONTROL_EXTRA
    ${VIREO_PACKAGE_BINARY_DIR}/control/postinst
    ${VIREO_PACKAGE_BINARY_DIR}/control/prerm
    ${VIREO_PACKAGE_BINARY_DIR}/control/postrm)
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)
# conffiles and triggers depend on what the install staged: this script adds them.
set(CPACK_PRE_BUILD_SCRIPTS ${VIREO_PACKAGE_DIR}/staged_files.cmake)
set(CPACK_VIREO_STRIP ${CMAKE_STRIP})
include(CPack)

# Once per CI run is enough: the ci tree has it, the tsan tree does not.
if(VIREO_BUILD_TESTS AND NOT VIREO_TSAN)
  add_test(NAME package_test
           COMMAND ${VIREO_PACKAGE_DIR}/package_test.sh ${PROJECT_BINARY_DIR} ${CMAKE_CPACK_COMMAND}
                   ${PROJECT_VERSION})
  set_tests_properties(package_test PROPERTIES SKIP_RETURN_CODE 77 TIMEOUT 240 LABELS package)
endif()
