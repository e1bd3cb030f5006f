# check_headers: compiles each header of the project alone, so a header that leans on what its includer
# happened to include before it does not build.
set(OX_HEADER_ROOTS
  ${PROJECT_SOURCE_DIR}/ox_support/src
  ${PROJECT_SOURCE_DIR}/ox_remote_dll/src
  ${PROJECT_SOURCE_DIR}/ox_remote_exe/src)

function(ox_add_header_check)
  set(units)
  foreach(root ${OX_HEADER_ROOTS})
    file(GLOB_RECURSE headers CONFIGURE_DEPENDS RELATIVE ${root} ${root}/*.h)
    foreach(header ${headers})
      string(REPLACE "/" "_" unit ${header})
      set(source ${PROJECT_BINARY_DIR}/headers/${unit}.cpp)
      file(CONFIGURE OUTPUT ${source} CONTENT "#include \"${header}\"\n#include \"${header}\"\n")
      list(APPEND units ${source})
    endforeach()
  endforeach()
  add_library(check_headers OBJECT EXCLUDE_FROM_ALL ${units})
  target_include_directories(check_headers PRIVATE ${OX_HEADER_ROOTS})
  target_link_libraries(check_headers PRIVATE ox_options)
endfunction()
