# Targets that can include only what they may: each layer gets an include directory of its own, in which its folders
# (and no others) stand as links; a target sees its own and those of the layers that it uses.

set(APPSYNC_WARNINGS -Wall -Wextra -Wpedantic -Wconversion -Wshadow -Werror)
if(CMAKE_CXX_COMPILER_ID STREQUAL "Clang")
  list(APPEND APPSYNC_WARNINGS -Wthread-safety)
elseif(NOT CMAKE_BUILD_TYPE STREQUAL "Debug")
  # What GCC 12 says here of optimised code is wrong: of a literal before a string, of an empty optional.
  list(APPEND APPSYNC_WARNINGS -Wno-restrict -Wno-maybe-uninitialized)
endif()
add_compile_options(${APPSYNC_WARNINGS})
if(APPSYNC_SANITIZE)
  add_compile_options(-fsanitize=${APPSYNC_SANITIZE} -fno-omit-frame-pointer -fno-sanitize-recover=all)
  add_link_options(-fsanitize=${APPSYNC_SANITIZE})
endif()

# Read once for each target. No source may rely on it: the release preset builds without.
set(APPSYNC_STANDARD_HEADERS <algorithm> <array> <atomic> <chrono> <condition_variable> <functional> <map> <memory>
    <mutex> <optional> <set> <span> <string> <string_view> <thread> <unordered_map> <utility> <vector>)

# appsync_layer(NAME FOLDERS folder... [USES layer...] [EXECUTABLE])
function(appsync_layer name)
  cmake_parse_arguments(LAYER "EXECUTABLE" "" "FOLDERS;USES" ${ARGN})
  set(include ${CMAKE_BINARY_DIR}/include/${name})
  set(sources)
  file(MAKE_DIRECTORY ${include})
  foreach(folder IN LISTS LAYER_FOLDERS)
    file(CREATE_LINK ${CMAKE_SOURCE_DIR}/${folder} ${include}/${folder} SYMBOLIC)
    file(GLOB found CONFIGURE_DEPENDS ${CMAKE_SOURCE_DIR}/${folder}/*.cpp)
    list(APPEND sources ${found})
  endforeach()
  list(REMOVE_ITEM sources ${CMAKE_SOURCE_DIR}/client/plugin.cpp)
  if(LAYER_EXECUTABLE)
    add_executable(${name} ${sources})
  else()
    add_library(${name} STATIC ${sources})
  endif()
  target_include_directories(${name} PUBLIC ${include})
  target_precompile_headers(${name} PRIVATE ${APPSYNC_STANDARD_HEADERS})
  target_link_libraries(${name} PUBLIC ${LAYER_USES})
endfunction()
