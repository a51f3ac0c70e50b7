# Run by CPack on the installed files before they are packed: what Debian wants otherwise than `cmake --install` puts
# it.
if(NOT CPACK_GENERATOR STREQUAL "DEB")
  return()
endif()

set(share ${CPACK_TEMPORARY_INSTALL_DIRECTORY}/usr/share)
set(doc ${share}/doc/memweight)
set(debian ${CMAKE_CURRENT_LIST_DIR}/debian)

file(STRINGS ${debian}/changelog entry LIMIT_COUNT 1)
set(version ${CPACK_PACKAGE_VERSION}-${CPACK_DEBIAN_PACKAGE_RELEASE})
if(NOT entry MATCHES "^memweight \\(${version}\\) ")
  message(FATAL_ERROR "packaging/debian/changelog has no entry for ${version}: ${entry}")
endif()

# The licence is among Debian's common ones, which `copyright` refers to.
file(REMOVE ${doc}/LICENSE)
file(RENAME ${doc}/CHANGELOG.md ${doc}/changelog)
file(COPY_FILE ${debian}/changelog ${doc}/changelog.Debian)
file(COPY_FILE ${debian}/copyright ${doc}/copyright)
# Debian's zsh looks here for what packages bring.
file(RENAME ${share}/zsh/site-functions ${share}/zsh/vendor-completions)

file(GLOB manuals ${share}/man/man1/*.1)
execute_process(COMMAND gzip -9n ${manuals} ${doc}/changelog ${doc}/changelog.Debian COMMAND_ERROR_IS_FATAL ANY)
file(GLOB_RECURSE files ${share}/*)
file(CHMOD ${files} FILE_PERMISSIONS OWNER_READ OWNER_WRITE GROUP_READ WORLD_READ)
