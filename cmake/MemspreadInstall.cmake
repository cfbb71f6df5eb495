# Installation and the Debian package: `cmake --install` and `cpack -G DEB`.
# The commands go to bin, their pages to share/man/man1 (compressed as Debian ships them), the
# bash completion to share/bash-completion/completions and the documentation to
# share/doc/memspread.
include(GNUInstallDirs)

install(TARGETS memspread RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR})

# The pages of man/, compressed with gzip -n, so that their bytes do not depend on the time of the
# build. vmsnap's page is installed with its command, below.
find_program(MEMSPREAD_GZIP gzip REQUIRED)
set(memspread_man_pages)
foreach(command memspread vmsnap)
  set(page ${CMAKE_SOURCE_DIR}/man/${command}.1)
  if(EXISTS ${page})
    set(compressed ${CMAKE_BINARY_DIR}/man/${command}.1.gz)
    add_custom_command(OUTPUT ${compressed}
      COMMAND ${CMAKE_COMMAND} -E make_directory ${CMAKE_BINARY_DIR}/man
      COMMAND ${MEMSPREAD_GZIP} -9 -n -c ${page} > ${compressed}
      DEPENDS ${page} VERBATIM)
    list(APPEND memspread_man_pages ${compressed})
  endif()
endforeach()
add_custom_target(memspread_man ALL DEPENDS ${memspread_man_pages})
install(FILES ${CMAKE_BINARY_DIR}/man/memspread.1.gz DESTINATION ${CMAKE_INSTALL_MANDIR}/man1)

# bash-completion loads a command's script by the command's name: the one script, which completes
# both commands, goes under both names (vmsnap's below).
install(FILES ${CMAKE_SOURCE_DIR}/completion/memspread.bash
        DESTINATION ${CMAKE_INSTALL_DATADIR}/bash-completion/completions RENAME memspread)

install(FILES ${CMAKE_SOURCE_DIR}/README.md DESTINATION ${CMAKE_INSTALL_DOCDIR})
install(DIRECTORY ${CMAKE_SOURCE_DIR}/docs/ DESTINATION ${CMAKE_INSTALL_DOCDIR} FILES_MATCHING PATTERN "*.md")

# The snapshot command may be defined anywhere in the tree: decide once the whole tree is read.
function(memspread_install_vmsnap)
  if(TARGET vmsnap)
    install(TARGETS vmsnap RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR})
    if(EXISTS ${CMAKE_SOURCE_DIR}/man/vmsnap.1)
      install(FILES ${CMAKE_BINARY_DIR}/man/vmsnap.1.gz DESTINATION ${CMAKE_INSTALL_MANDIR}/man1)
    endif()
    install(FILES ${CMAKE_SOURCE_DIR}/completion/memspread.bash
            DESTINATION ${CMAKE_INSTALL_DATADIR}/bash-completion/completions RENAME vmsnap)
  endif()
endfunction()
cmake_language(DEFER DIRECTORY ${CMAKE_SOURCE_DIR} CALL memspread_install_vmsnap)

# The package's dependencies are those of the installed binaries, as dpkg-shlibdeps (dpkg-dev)
# finds them: libbsd0 and the C and C++ runtimes, at the versions this build needs.
set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME memspread)
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGE_CONTACT "memspread developers <dev@memspread.invalid>")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "physical memory cost of processes, with shared memory counted once")
# The summary is the first line of the package's description, these lines the rest.
set(CPACK_DEBIAN_PACKAGE_DESCRIPTION
    "memspread measures what one process, a set of processes or every process
of the system costs in physical memory, broken down by kind of memory
(dirty, swapped, clean, reclaimable, wired). Memory that several processes
share is counted once and shown under the exact set of processes that
share it. It writes a text report and, on request, a JSON document.
vmsnap saves processes to snapshot files that memspread reports later.")
set(CPACK_DEBIAN_PACKAGE_SECTION admin)
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_STRIP_FILES ON)
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
include(CPack)
