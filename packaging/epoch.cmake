# Sets all times in a package to the time of the commit, so that every build of a commit gives the
# same package. Runs when the build is configured and again in cpack.
if(NOT DEFINED ENV{SOURCE_DATE_EPOCH})
  execute_process(COMMAND git -C ${CMAKE_CURRENT_LIST_DIR} log -1 --format=%ct
                  OUTPUT_VARIABLE Epoch OUTPUT_STRIP_TRAILING_WHITESPACE)
  if(Epoch)
    set(ENV{SOURCE_DATE_EPOCH} ${Epoch})
  endif()
endif()
