# What is installed beside the programs, and the Debian package of all of it. Needs GNUInstallDirs.

# Manual pages name the version, which the build knows. `man -M BUILD/man heft` shows them before anything is installed.
file(GLOB pages CONFIGURE_DEPENDS RELATIVE ${CMAKE_SOURCE_DIR}/docs/man ${CMAKE_SOURCE_DIR}/docs/man/man*/*)
foreach(page ${pages})
    configure_file(docs/man/${page} man/${page} @ONLY)
    get_filename_component(section ${page} DIRECTORY)
    install(FILES ${CMAKE_BINARY_DIR}/man/${page} DESTINATION ${CMAKE_INSTALL_MANDIR}/${section})
endforeach()

file(GLOB documents CONFIGURE_DEPENDS docs/*.md docs/*.json)
install(FILES README.md CHANGELOG.md DESTINATION ${CMAKE_INSTALL_DOCDIR})
install(FILES ${documents} DESTINATION ${CMAKE_INSTALL_DOCDIR}/docs)

# What heft-metrics is run by, and what asks for its figures. Nothing is enabled.
if(HEFT_COMPANIONS)
    set(HEFT_SYSTEMD_UNITS lib/systemd/system CACHE STRING "Folder of systemd's units")
    install(DIRECTORY packaging/systemd/ DESTINATION ${HEFT_SYSTEMD_UNITS})
    install(DIRECTORY packaging/prometheus packaging/grafana DESTINATION ${CMAKE_INSTALL_DOCDIR}/examples)
endif()

# Where the shells look below the prefix. Debian's zsh has another folder for packages than for /usr/local.
set(HEFT_BASH_COMPLETIONS ${CMAKE_INSTALL_DATADIR}/bash-completion/completions CACHE STRING "Folder of bash's completions")
set(HEFT_ZSH_COMPLETIONS ${CMAKE_INSTALL_DATADIR}/zsh/site-functions CACHE STRING "Folder of zsh's completions")
set(HEFT_FISH_COMPLETIONS ${CMAKE_INSTALL_DATADIR}/fish/vendor_completions.d CACHE STRING "Folder of fish's completions")
install(FILES completions/_heft DESTINATION ${HEFT_ZSH_COMPLETIONS})
foreach(program heft heft-record heft-replay ${COMPANIONS})
    install(FILES completions/heft.bash DESTINATION ${HEFT_BASH_COMPLETIONS} RENAME ${program})
    install(FILES completions/heft.fish DESTINATION ${HEFT_FISH_COMPLETIONS} RENAME ${program}.fish)
endforeach()

# script/package makes it.
set(CPACK_GENERATOR DEB)
set(HEFT_CONTACT "heft maintainers <heft@example.org>" CACHE STRING "Whom the package names as its maintainer")
set(CPACK_PACKAGE_CONTACT ${HEFT_CONTACT})
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "physical memory charged to processes, explained")
set(CPACK_DEBIAN_PACKAGE_DESCRIPTION
"heft tells how much physical memory the kernel charges to a process, to a
set of processes or to the whole machine, and explains the charge: by
category, by the exact set of processes that share the memory and, on
request, region by region. Captures of a machine can be reported on later.")
set(CPACK_DEBIAN_PACKAGE_SECTION utils)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_RELEASE 1)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_STRIP_FILES ON)
set(CPACK_INSTALL_DEFAULT_DIRECTORY_PERMISSIONS
    OWNER_READ OWNER_WRITE OWNER_EXECUTE GROUP_READ GROUP_EXECUTE WORLD_READ WORLD_EXECUTE)
set(CPACK_PRE_BUILD_SCRIPTS ${CMAKE_SOURCE_DIR}/cmake/HeftDebian.cmake)
include(CPack)
