# How the tests are declared; what each kind is stands in README.md.

set(quarn_kernel_settings ${CMAKE_CURRENT_LIST_DIR}/security/kernel_settings.py)

# A GoogleTest program and its CTest entry, on the scripted platform. One entry a program: a process
# start per case would cost more than the cases.
#   REAL_SERVICES  the platform or the transport itself is under test: nothing scripted is linked
#   TIMEOUT        of the program, in seconds (60)
#   LABELS         unit when there are none
#   SETTINGS       kernel settings that it needs, as name=value; it is alone with those who set some
function(quarn_unit_test name)
  cmake_parse_arguments(ARG "REAL_SERVICES" "TIMEOUT" "SOURCES;LIBS;LABELS;SETTINGS" ${ARGN})
  add_executable(${name} ${ARG_SOURCES})
  if(ARG_REAL_SERVICES)
    target_link_libraries(${name} PRIVATE quarn_options ${ARG_LIBS} quarn_test_base)
  else()
    target_link_libraries(${name} PRIVATE quarn_options ${ARG_LIBS} quarn_test_support)
    target_precompile_headers(${name} REUSE_FROM quarn_test_support)
  endif()
  if(NOT ARG_TIMEOUT)
    set(ARG_TIMEOUT 60)
  endif()
  if(NOT ARG_LABELS)
    set(ARG_LABELS unit)
  endif()
  set(command $<TARGET_FILE:${name}>)
  if(ARG_SETTINGS)
    set(command ${quarn_kernel_settings} ${ARG_SETTINGS} -- ${command})
  endif()
  add_test(NAME ${name} COMMAND ${command})
  set_tests_properties(${name} PROPERTIES TIMEOUT ${ARG_TIMEOUT} LABELS "${ARG_LABELS}")
  if(ARG_SETTINGS)
    set_tests_properties(${name} PROPERTIES RESOURCE_LOCK kernel_settings)
  endif()
endfunction()

# Every test_*.py in a folder below this one is a CTest entry of that label: the real programs, real
# devices. Whoever changes the machine's settings is alone with those who do the same.
function(quarn_python_tests label)
  file(GLOB tests CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/*/test_*.py)
  foreach(test IN LISTS tests)
    get_filename_component(file ${test} NAME_WE)
    set(name ${label}_${file})
    add_test(NAME ${name} COMMAND /usr/bin/python3 -B ${test})
    set_tests_properties(
      ${name} PROPERTIES LABELS ${label} TIMEOUT 600
      ENVIRONMENT "QUARN_BIN_DIR=${QUARN_BIN_DIR};QUARN_BUILD_DIR=${CMAKE_BINARY_DIR}")
    file(STRINGS ${test} needs_settings REGEX "kernel_settings" LIMIT_COUNT 1)
    if(needs_settings)
      set_tests_properties(${name} PROPERTIES RESOURCE_LOCK kernel_settings)
    endif()
  endforeach()
endfunction()

# Every folder below this one that has a CMakeLists.txt of its own.
function(quarn_test_folders)
  file(GLOB lists CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/*/CMakeLists.txt)
  foreach(list IN LISTS lists)
    get_filename_component(folder ${list} DIRECTORY)
    add_subdirectory(${folder})
  endforeach()
endfunction()
