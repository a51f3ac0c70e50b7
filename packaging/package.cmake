# The Debian package: `cpack -G DEB` in the folder of a release build, or scripts/package.
set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME memweight)
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGE_CONTACT "memweight developers <memweight@example.org>")
set(CPACK_PACKAGE_VENDOR "memweight developers")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "tell where memory goes and who shares it with whom")
set(CPACK_PACKAGE_DESCRIPTION
"memweight measures how much memory a process, some processes or all processes
of a machine charge to it. It joins what they share into memory objects, so
that no page counts twice, and reports by kind of memory, by process, by group
of processes that share memory, and in sum. It only reads /proc, and needs
neither a kernel module nor tracing.")
set(CPACK_RESOURCE_FILE_LICENSE ${CMAKE_SOURCE_DIR}/LICENSE)
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_STRIP_FILES ON)
# Whatever the umask of the one who builds.
set(CPACK_INSTALL_DEFAULT_DIRECTORY_PERMISSIONS OWNER_READ OWNER_WRITE OWNER_EXECUTE GROUP_READ GROUP_EXECUTE
                                                WORLD_READ WORLD_EXECUTE)

set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_RELEASE 1)
set(CPACK_DEBIAN_PACKAGE_SECTION utils)
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)
set(CPACK_PRE_BUILD_SCRIPTS ${CMAKE_CURRENT_LIST_DIR}/debian.cmake)

include(CPack)
