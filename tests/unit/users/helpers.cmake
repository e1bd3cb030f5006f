# What the tests of operating-system accounts start and load: a program that runs checks, and a PAM library that does
# what a test says, whole and without each of its functions.

add_executable(accountcheck users/accountcheck/accountcheck.cpp)
target_include_directories(accountcheck PRIVATE ${CMAKE_CURRENT_SOURCE_DIR})
target_link_libraries(accountcheck PRIVATE ox_remote_dll)

set(fake_pam_directory ${CMAKE_CURRENT_BINARY_DIR}/fakepam)
function(ox_add_fake_pam name)
  add_library(${name} MODULE users/fakepam/fakepam.cpp)
  target_link_libraries(${name} PRIVATE ox_options)
  target_compile_definitions(${name} PRIVATE ${ARGN})
  set_target_properties(${name} PROPERTIES LIBRARY_OUTPUT_DIRECTORY ${fake_pam_directory})
  add_dependencies(unit_users ${name})
endfunction()

ox_add_fake_pam(fakepam)
foreach(function pam_start pam_authenticate pam_acct_mgmt pam_setcred pam_end pam_strerror)
  ox_add_fake_pam(fakepam_without_${function} WITHOUT_${function})
endforeach()

add_dependencies(unit_users accountcheck)
target_compile_definitions(unit_users PRIVATE
  OX_ACCOUNT_CHECK="$<TARGET_FILE:accountcheck>"
  OX_FAKE_PAM_DIRECTORY="${fake_pam_directory}")
target_link_libraries(unit_users PRIVATE crypt)
