# How this project's targets are made: warnings, sanitizers and run paths in one place, carried by targets only.

add_library(zn_options INTERFACE)
target_compile_options(zn_options INTERFACE -Wall -Wextra -Wpedantic -Wshadow -Werror
                       $<$<CXX_COMPILER_ID:Clang>:-Wthread-safety -Werror=thread-safety>)
target_include_directories(zn_options INTERFACE ${PROJECT_SOURCE_DIR} ${PROJECT_SOURCE_DIR}/platform
                           ${PROJECT_SOURCE_DIR}/platform/cu
                           ${PROJECT_SOURCE_DIR}/platform/kpl
                           ${PROJECT_SOURCE_DIR}/platform/gs)
if(ZN_SANITIZE)
  target_compile_options(zn_options INTERFACE -fsanitize=${ZN_SANITIZE} -fno-omit-frame-pointer
                         -fno-sanitize-recover=all)
  target_link_options(zn_options INTERFACE -fsanitize=${ZN_SANITIZE})
endif()

# zn_shared_library(NAME SOURCES...): a library whose file name and soname are exactly libNAME.so and which finds
# its fellows beside it.
function(zn_shared_library name)
  add_library(${name} SHARED ${ARGN})
  target_link_libraries(${name} PRIVATE zn_options Threads::Threads)
  set_target_properties(${name} PROPERTIES INSTALL_RPATH "$ORIGIN")
endfunction()

# zn_program(NAME SOURCES...): a program in bin/ that finds the libraries in ../lib.
function(zn_program name)
  add_executable(${name} ${ARGN})
  target_link_libraries(${name} PRIVATE zn_options Threads::Threads)
  set_target_properties(${name} PROPERTIES INSTALL_RPATH "$ORIGIN/../${CMAKE_INSTALL_LIBDIR};$ORIGIN/../lib")
endfunction()
