# Run by cpack once the files are staged: strips the debugging symbols of static
# libraries (cpack strips only programs and shared libraries), marks what the package
# puts under /etc as conffiles, and has dpkg run ldconfig for shared libraries.
set(stage "${CPACK_TEMPORARY_DIRECTORY}")
# Beside the staging tree, so that each cpack run has its own.
set(control "${CPACK_TEMPORARY_DIRECTORY}.control")
file(REMOVE_RECURSE "${control}")

file(GLOB_RECURSE static_libraries LIST_DIRECTORIES false "${stage}/usr/lib/*.a")
foreach(library IN LISTS static_libraries)
  execute_process(COMMAND "${CPACK_VIREO_STRIP}" --strip-debug --enable-deterministic-archives
                          --remove-section=.comment "${library}"
                  COMMAND_ERROR_IS_FATAL ANY)
endforeach()

file(GLOB_RECURSE etc_files LIST_DIRECTORIES false RELATIVE "${stage}" "${stage}/etc/*")
if(etc_files)
  list(SORT etc_files)
  list(TRANSFORM etc_files PREPEND "/")
  list(JOIN etc_files "\n" text)
  file(WRITE "${control}/conffiles" "${text}\n")
  list(APPEND CPACK_DEBIAN_PACKAGE_CONTROL_EXTRA "${control}/conffiles")
endif()

file(GLOB_RECURSE shared_libraries LIST_DIRECTORIES false "${stage}/usr/lib/*.so.*")
if(shared_libraries)
  file(WRITE "${control}/triggers" "activate-noawait ldconfig\n")
  list(APPEND CPACK_DEBIAN_PACKAGE_CONTROL_EXTRA "${control}/triggers")
endif()
