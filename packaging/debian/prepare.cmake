# Run by cpack on what it is going to pack: adds what only a Debian package has, and compresses pages and changelog as Debian
# wants them (gzip -9n: without a date in it; SOURCE_DATE_EPOCH sets the changelog's).
set(documents ${CPACK_TEMPORARY_DIRECTORY}/usr/share/doc/rolvane)
string(TIMESTAMP PACKAGE_DATE "%a, %d %b %Y %H:%M:%S +0000" UTC)
configure_file(${CMAKE_CURRENT_LIST_DIR}/changelog.in ${documents}/changelog @ONLY)
file(COPY ${CMAKE_CURRENT_LIST_DIR}/copyright DESTINATION ${documents})
file(GLOB_RECURSE pages ${CPACK_TEMPORARY_DIRECTORY}/usr/share/man/*.[1-8])
foreach(file ${pages} ${documents}/changelog)
  execute_process(COMMAND gzip -9nf ${file} COMMAND_ERROR_IS_FATAL ANY)
endforeach()
