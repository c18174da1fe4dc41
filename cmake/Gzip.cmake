find_program(GZIP_EXECUTABLE gzip REQUIRED)

# Compresses File to NAME.gz in the current binary directory. Equal contents give equal bytes.
function(gzip File)
  cmake_path(GET File FILENAME Name)
  add_custom_command(OUTPUT ${Name}.gz COMMAND ${GZIP_EXECUTABLE} -9nc ${File} > ${Name}.gz
                     DEPENDS ${File} VERBATIM)
  add_custom_target(${Name}.gz-target ALL DEPENDS ${Name}.gz)
endfunction()
