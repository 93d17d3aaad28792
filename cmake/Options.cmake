# vx_options: what every target of the project is compiled with. Linked privately, so that nobody else inherits it.
add_library(vx_options INTERFACE)
target_compile_features(vx_options INTERFACE cxx_std_20)
target_include_directories(vx_options INTERFACE ${PROJECT_SOURCE_DIR})
if(VX_CHECKS)
  target_compile_definitions(vx_options INTERFACE VX_CHECKS)
endif()
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
if(VX_FUZZ)
  target_compile_options(vx_options INTERFACE -fsanitize=fuzzer-no-link)  # or fuzzers would be blind inside libraries
endif()

# Adds a static library whose link line is the list of what its layer may see.
function(vx_library name)
  cmake_parse_arguments(ARG "" "" "SOURCES;LINK;PRIVATE_LINK" ${ARGN})
  add_library(${name} STATIC ${ARG_SOURCES})
  set_target_properties(${name} PROPERTIES CXX_EXTENSIONS OFF)
  target_compile_features(${name} PUBLIC cxx_std_20)
  target_include_directories(${name} PUBLIC ${PROJECT_SOURCE_DIR})
  target_link_libraries(${name} PUBLIC ${ARG_LINK} PRIVATE vx_options ${ARG_PRIVATE_LINK})
endfunction()

# Adds a program.
function(vx_program name)
  cmake_parse_arguments(ARG "" "" "SOURCES;LINK" ${ARGN})
  add_executable(${name} ${ARG_SOURCES})
  set_target_properties(${name} PROPERTIES CXX_EXTENSIONS OFF)
  target_link_libraries(${name} PRIVATE vx_options ${ARG_LINK})
endfunction()

# Adds a program in C over the C interface.
function(vx_c_program name)
  add_executable(${name} ${ARGN})
  set_target_properties(${name} PROPERTIES C_STANDARD 11 C_STANDARD_REQUIRED ON)
  target_compile_options(${name} PRIVATE -Wall -Wextra -Wpedantic $<$<BOOL:${VX_WERROR}>:-Werror>)
  target_link_libraries(${name} PRIVATE vxreporting)
  if(VX_SANITIZE)  # what the library needs then comes with its own compiler
    set_target_properties(${name} PROPERTIES LINKER_LANGUAGE CXX)
    target_link_options(${name} PRIVATE -fsanitize=${VX_SANITIZE})
  endif()
endfunction()

# The TOML parser is compiled in: one shared library less to load, and no other one that is C++.
function(vx_uses_toml name)
  target_include_directories(${name} SYSTEM PRIVATE ${TOMLPP_INCLUDE_DIRS})
  target_compile_definitions(${name} PRIVATE TOML_HEADER_ONLY=1)
  # What it asserts some files do not hold; it goes on to say what is wrong with them. Not a definition: CMake knows none
  # with arguments.
  target_compile_options(${name} PRIVATE "-DTOML_ASSERT(expr)=static_assert(true)")
endfunction()
