# The Debian package (cpack -G DEB in the build directory): the libraries,
# headers, CMake package, pkg-config file, shipped plug-ins, icctl, icd, and,
# for the package only, the systemd unit, /etc/default/icd and the docs.
# The package installs under /usr whatever prefix the build was configured
# with: the library finds its plug-ins relative to itself. Configure with
# -DCMAKE_INSTALL_PREFIX=/usr for Debian's multiarch library directory.

# The "system" component holds what only a package may install: absolute
# paths, and a unit that names /usr/bin/icd. `cmake --install` leaves it out.
if(TARGET icd)
  install(FILES packaging/icd.service DESTINATION lib/systemd/system
    COMPONENT system EXCLUDE_FROM_ALL)
  install(FILES packaging/icd.default DESTINATION /etc/default RENAME icd
    COMPONENT system EXCLUDE_FROM_ALL)
endif()
install(FILES README.md DESTINATION share/doc/instrumentationcontrol
  COMPONENT system EXCLUDE_FROM_ALL)

set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME instrumentationcontrol)
set(CPACK_PACKAGE_VENDOR "Instrumentation control")
set(CPACK_PACKAGE_CONTACT "Instrumentation control maintainers <root@localhost>" CACHE STRING
  "Maintainer field of the Debian package")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "one view of a server's hardware: library, plug-ins, icctl and the icd agent")
set(CPACK_PACKAGE_DESCRIPTION
  "A shared library that loads management-interface plug-ins (which read the
hardware) and functional plug-ins (which derive alerts), keeps every
hardware node under a stable path and routes alerts to clients. Ships the
Linux hardware and health plug-ins, the icctl command-line host and icd,
a daemon serving Prometheus metrics, a JSON API with live events and a
web page, with its systemd unit. Includes headers, the CMake package and
the pkg-config file for building clients and plug-ins.")
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
# The default install (everything not excluded) and the package-only files.
set(CPACK_INSTALL_CMAKE_PROJECTS
  "${PROJECT_BINARY_DIR};${PROJECT_NAME};ALL;/"
  "${PROJECT_BINARY_DIR};${PROJECT_NAME};system;/")
set(CPACK_STRIP_FILES ON)

set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SECTION admin)
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)
set(CPACK_DEBIAN_PACKAGE_RELEASE 1)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
# Our own libraries, for dpkg-shlibdeps to resolve the programs' and
# plug-ins' needs on them within the package.
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS_PRIVATE_DIRS "${PROJECT_BINARY_DIR}/common;${PROJECT_BINARY_DIR}")
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS ON)
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)
set(CPACK_DEBIAN_PACKAGE_CONTROL_EXTRA ${PROJECT_SOURCE_DIR}/packaging/triggers)
if(TARGET icd)
  list(APPEND CPACK_DEBIAN_PACKAGE_CONTROL_EXTRA
    ${PROJECT_SOURCE_DIR}/packaging/conffiles
    ${PROJECT_SOURCE_DIR}/packaging/postinst
    ${PROJECT_SOURCE_DIR}/packaging/prerm
    ${PROJECT_SOURCE_DIR}/packaging/postrm)
endif()
include(CPack)
