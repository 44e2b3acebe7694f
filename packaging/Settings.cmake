# Puts a file into /etc, for "cmake --install" and for the packages. Expects szFrom, szTo and rgMode. Promises: a file
# that is there and differs stays as it is.
set(szPlace "$ENV{DESTDIR}${szTo}")
execute_process(COMMAND cmp -s "${szFrom}" "${szPlace}" RESULT_VARIABLE nDiffers ERROR_QUIET)
if(EXISTS "${szPlace}" AND nDiffers)
  message(STATUS "Kept: ${szPlace}; compare it with ${szPlace}.new")
  string(APPEND szPlace ".new")
endif()
cmake_path(GET szPlace PARENT_PATH szDir)
file(MAKE_DIRECTORY "${szDir}")
file(COPY_FILE "${szFrom}" "${szPlace}")
file(CHMOD "${szPlace}" PERMISSIONS ${rgMode})
