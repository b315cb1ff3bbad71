# Run by CPack on what is about to be packed: what Debian asks of packages and other systems do not.

set(share ${CPACK_TEMPORARY_INSTALL_DIRECTORY}/usr/share)
set(doc ${share}/doc/heft)

file(WRITE ${doc}/copyright "heft: Copyright 2026 the owner of heft.

The owner has not chosen a licence yet. Until then all rights are reserved.
")

set(log ${doc}/changelog.Debian)
string(TIMESTAMP date "%a, %d %b %Y %H:%M:%S +0000" UTC)
file(WRITE ${log} "heft (${CPACK_PACKAGE_VERSION}-${CPACK_DEBIAN_PACKAGE_RELEASE}) unstable; urgency=medium

  * Packaged from the sources by CPack; changelog.gz tells what is new.

 -- ${CPACK_PACKAGE_CONTACT}  ${date}
")
file(RENAME ${doc}/CHANGELOG.md ${doc}/changelog)

file(GLOB compressed ${share}/man/man*/* ${log} ${doc}/changelog)
execute_process(COMMAND gzip -9n ${compressed} COMMAND_ERROR_IS_FATAL ANY)
