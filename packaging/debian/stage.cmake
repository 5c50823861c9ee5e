# Run by CPack on the staged files, before the package is made of them: what Debian wants compressed.
file(GLOB_RECURSE files "${CPACK_TEMPORARY_INSTALL_DIRECTORY}/usr/share/man/*.[0-9]"
                        "${CPACK_TEMPORARY_INSTALL_DIRECTORY}/usr/share/doc/*/changelog")
execute_process(COMMAND gzip -9n ${files} COMMAND_ERROR_IS_FATAL ANY)
