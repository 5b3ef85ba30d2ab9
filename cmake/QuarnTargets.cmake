# Compiler settings shared by every target, and the helpers that make them.

add_library(quarn_options INTERFACE)
# -pthread everywhere: some libraries ask for it, and the precompiled header must agree.
target_compile_options(quarn_options INTERFACE -Wall -Wextra -Wpedantic -pthread)
if(QUARN_WERROR)
  target_compile_options(quarn_options INTERFACE -Werror)
endif()
if(QUARN_SANITIZE)
  target_compile_options(quarn_options INTERFACE -fsanitize=${QUARN_SANITIZE} -fno-omit-frame-pointer
                                                 -fno-sanitize-recover=all)
  target_link_options(quarn_options INTERFACE -fsanitize=${QUARN_SANITIZE})
else()
  target_compile_definitions(quarn_options INTERFACE $<$<CONFIG:Release>:_FORTIFY_SOURCE=2>)
  target_compile_options(quarn_options INTERFACE -fstack-protector-strong)
  target_link_options(quarn_options INTERFACE -Wl,-z,relro,-z,now -Wl,--as-needed)
endif()

# One unit of the daemon: a static library of its sources.
function(quarn_unit name)
  cmake_parse_arguments(ARG "" "" "SOURCES;LIBS" ${ARGN})
  add_library(${name} STATIC ${ARG_SOURCES})
  target_include_directories(${name} PUBLIC ${PROJECT_SOURCE_DIR}/daemon)
  target_link_libraries(${name} PUBLIC quarn_options quarn_common ${ARG_LIBS})
endfunction()

# A program that lies in build/bin.
function(quarn_program name)
  cmake_parse_arguments(ARG "" "" "SOURCES;LIBS" ${ARGN})
  add_executable(${name} ${ARG_SOURCES})
  target_link_libraries(${name} PRIVATE quarn_options ${ARG_LIBS})
  set_target_properties(${name} PROPERTIES RUNTIME_OUTPUT_DIRECTORY "${QUARN_BIN_DIR}")
endfunction()
