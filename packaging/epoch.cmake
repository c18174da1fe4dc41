# All times in a package are the commit's, so that it comes out the same whenever it is built. Runs
# when the build is configured, and again in cpack.
if(NOT DEFINED ENV{SOURCE_DATE_EPOCH})
  execute_process(COMMAND git -C ${CMAKE_CURRENT_LIST_DIR} log -1 --format=%ct
                  OUTPUT_VARIABLE Epoch OUTPUT_STRIP_TRAILING_WHITESPACE)
  if(Epoch)
    set(ENV{SOURCE_DATE_EPOCH} ${Epoch})
  endif()
endif()
