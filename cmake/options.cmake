# What every target of the project is compiled with.
add_library(ox_options INTERFACE)
target_compile_options(ox_options INTERFACE
  -Wall -Wextra -Wpedantic -Wconversion -Wshadow -Werror)
target_compile_definitions(ox_options INTERFACE
  _GNU_SOURCE
  # Files over 2 GB and times after 2038 on 32-bit machines.
  _FILE_OFFSET_BITS=64
  _TIME_BITS=64)
# Nothing of the program is patched at run time: a child that is being started must not look up symbols, either.
target_link_options(ox_options INTERFACE -Wl,-z,relro,-z,now)
target_link_libraries(ox_options INTERFACE Threads::Threads ${CMAKE_DL_LIBS})

if(OX_SANITIZE)
  target_compile_options(ox_options INTERFACE
    -fsanitize=${OX_SANITIZE} -fno-sanitize-recover=all -fno-omit-frame-pointer)
  target_link_options(ox_options INTERFACE -fsanitize=${OX_SANITIZE})
  if(OX_SANITIZE MATCHES "undefined")
    # This check opens a pipe for each look at an object, and takes its failure without a free descriptor for a finding.
    target_compile_options(ox_options INTERFACE -fno-sanitize=vptr)
    target_link_options(ox_options INTERFACE -fno-sanitize=vptr)
  endif()
  if(CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
    # The instrumentation makes this warning cry wolf, inside the standard library too; the other builds keep it.
    target_compile_options(ox_options INTERFACE -Wno-maybe-uninitialized)
  endif()
endif()

if(OX_BUILD_FUZZERS)
  # The libraries report what they run through, else a target searches blindly in everything but its own file.
  target_compile_options(ox_options INTERFACE -fsanitize=fuzzer-no-link)
  target_link_options(ox_options INTERFACE -fsanitize=fuzzer-no-link)
endif()
