# vx_options: what every target of the project is compiled with.
add_library(vx_options INTERFACE)
target_include_directories(vx_options INTERFACE ${PROJECT_SOURCE_DIR})
target_compile_options(vx_options INTERFACE -Wall -Wextra -Wnon-virtual-dtor -Wold-style-cast
                                            -Wcast-qual -Wformat=2 -Wno-format-nonliteral
                                            $<$<CXX_COMPILER_ID:GNU>:-Wno-restrict> $<$<CXX_COMPILER_ID:GNU>:-Wshadow=local>
                                            $<$<CXX_COMPILER_ID:Clang>:-Wshadow> -Wno-unused-parameter)
if(VX_WERROR)
  target_compile_options(vx_options INTERFACE -Werror)
endif()
if(CMAKE_CXX_COMPILER_ID MATCHES Clang)
  target_compile_options(vx_options INTERFACE -Wthread-safety -Werror=thread-safety)
endif()
if(VX_SANITIZE)
  target_compile_options(vx_options INTERFACE -fsanitize=${VX_SANITIZE} -fno-omit-frame-pointer
                                              -fno-sanitize-recover=all)
  target_link_options(vx_options INTERFACE -fsanitize=${VX_SANITIZE})
  if(VX_SANITIZE MATCHES thread)
    target_compile_options(vx_options INTERFACE $<$<CXX_COMPILER_ID:GNU>:-Wno-tsan>)
  endif()
endif()

# Adds a static library whose link line is the list of what its layer may see.
function(vx_library name)
  cmake_parse_arguments(ARG "" "" "SOURCES;LINK;PRIVATE_LINK" ${ARGN})
  add_library(${name} STATIC ${ARG_SOURCES})
  target_link_libraries(${name} PUBLIC vx_options ${ARG_LINK} PRIVATE ${ARG_PRIVATE_LINK})
endfunction()
