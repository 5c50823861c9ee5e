# What is installed and how it is found again: libraries, programs, public headers, the CMake package zn_gscl, the
# pkg-config file and the Debian package. Included last, when all targets are there.
include(CMakePackageConfigHelpers)

# The libraries that users link against, and the one that is loaded at run time.
install(TARGETS zn_gscl zn_cu kpl EXPORT zn_gscl
        LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR}
        INCLUDES DESTINATION ${CMAKE_INSTALL_INCLUDEDIR})
install(TARGETS wyx_r LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR})

install(FILES ${ZN_PUBLIC_GSCL_HEADERS} DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}/gscl)
install(FILES dae/dae.h DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}/dae)
install(FILES platform/cu/zn_cu.h platform/kpl/kpl.h DESTINATION ${CMAKE_INSTALL_INCLUDEDIR})

# find_package(zn_gscl) gives zn_gscl::zn_gscl and zn_gscl::zn_cu.
set(package_dir ${CMAKE_INSTALL_LIBDIR}/cmake/zn_gscl)
install(EXPORT zn_gscl NAMESPACE zn_gscl:: DESTINATION ${package_dir})
configure_package_config_file(packaging/zn_gsclConfig.cmake.in ${CMAKE_BINARY_DIR}/packaging/zn_gsclConfig.cmake
                              INSTALL_DESTINATION ${package_dir})
write_basic_package_version_file(${CMAKE_BINARY_DIR}/packaging/zn_gsclConfigVersion.cmake
                                 COMPATIBILITY SameMajorVersion)
install(FILES ${CMAKE_BINARY_DIR}/packaging/zn_gsclConfig.cmake
              ${CMAKE_BINARY_DIR}/packaging/zn_gsclConfigVersion.cmake DESTINATION ${package_dir})

# The .pc file finds its prefix from where it lies, so that a moved tree still works.
file(RELATIVE_PATH pc_to_prefix /${CMAKE_INSTALL_LIBDIR}/pkgconfig /)
configure_file(packaging/zn_gscl.pc.in ${CMAKE_BINARY_DIR}/packaging/zn_gscl.pc @ONLY)
install(FILES ${CMAKE_BINARY_DIR}/packaging/zn_gscl.pc DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig)

set(CPACK_PACKAGE_NAME zn-gscl)
set(CPACK_PACKAGE_VENDOR "zn-gscl")
# The developers have no address yet.
set(CPACK_PACKAGE_CONTACT "The zn-gscl developers <zn-gscl@zn-gscl.invalid>")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "group services: client library, daemon, and a master of daemons")
set(CPACK_PACKAGE_DESCRIPTION "Processes form named groups, on one host or on several. They agree by voting
on who is in and on a shared state value, send each other messages in one
order, and are told when one of them dies.
.
This package has the C++ library with its headers, the base API library, the
daemon gsd, the command gsctl, which shows and changes groups and runs a
program in one place at a time, and kplmstr with kplctl, which start, watch
and ask daemons.")
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SECTION net)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS_PRIVATE_DIRS ${CMAKE_LIBRARY_OUTPUT_DIRECTORY})
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_STRIP_FILES ON)

# What only a Debian package has.
set(debian ${PROJECT_SOURCE_DIR}/packaging/debian)
configure_file(${debian}/changelog.in ${CMAKE_BINARY_DIR}/packaging/debian/doc/changelog @ONLY)
configure_file(${debian}/copyright ${CMAKE_BINARY_DIR}/packaging/debian/doc/copyright COPYONLY)
configure_file(${debian}/lintian-overrides ${CMAKE_BINARY_DIR}/packaging/debian/overrides/zn-gscl COPYONLY)
set(CPACK_INSTALLED_DIRECTORIES ${CMAKE_BINARY_DIR}/packaging/debian/doc usr/share/doc/zn-gscl
                                ${CMAKE_BINARY_DIR}/packaging/debian/overrides usr/share/lintian/overrides)
set(CPACK_PRE_BUILD_SCRIPTS ${debian}/stage.cmake)
set(CPACK_DEBIAN_PACKAGE_CONTROL_EXTRA ${debian}/triggers)
include(CPack)
