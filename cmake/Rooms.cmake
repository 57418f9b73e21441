# A room is one library target. Its headers are reached as "room/Header.h" through an include directory that holds
# nothing but that room, so a room can include another only when it links it: the link graph is the architecture.

set(ROLVANE_INCLUDE_ROOT ${CMAKE_BINARY_DIR}/include)

function(rolvane_warnings target)
  target_compile_options(${target} PRIVATE -Wall -Wextra -Wpedantic -Wshadow -Wnon-virtual-dtor -Woverloaded-virtual)
  if(ROLVANE_WERROR)
    target_compile_options(${target} PRIVATE -Werror)
  endif()
endfunction()

if(ROLVANE_SANITIZE)
  add_compile_options(-fsanitize=${ROLVANE_SANITIZE} -fno-omit-frame-pointer -fno-sanitize-recover=all)
  add_link_options(-fsanitize=${ROLVANE_SANITIZE})
endif()

# rolvane_room(NAME [FOLDERS folder...] [ROOMS room...] [PUBLIC lib...] [PRIVATE lib...])
# Sources are all *.cpp of the current directory and of the folders.
function(rolvane_room name)
  cmake_parse_arguments(ARG "" "" "FOLDERS;ROOMS;PUBLIC;PRIVATE" ${ARGN})
  set(root ${ROLVANE_INCLUDE_ROOT}/${name})
  file(MAKE_DIRECTORY ${root})
  file(CREATE_LINK ${CMAKE_CURRENT_SOURCE_DIR} ${root}/${name} SYMBOLIC)
  list(TRANSFORM ARG_FOLDERS APPEND "/*.cpp" OUTPUT_VARIABLE in_folders)
  file(GLOB sources CONFIGURE_DEPENDS *.cpp ${in_folders})
  list(TRANSFORM ARG_ROOMS PREPEND rolvane_)
  if(sources)
    add_library(rolvane_${name} STATIC ${sources})
    target_include_directories(rolvane_${name} PUBLIC ${root})
    target_link_libraries(rolvane_${name} PUBLIC ${ARG_ROOMS} ${ARG_PUBLIC} PRIVATE ${ARG_PRIVATE})
    rolvane_warnings(rolvane_${name})
  else()
    add_library(rolvane_${name} INTERFACE)
    target_include_directories(rolvane_${name} INTERFACE ${root})
    target_link_libraries(rolvane_${name} INTERFACE ${ARG_ROOMS} ${ARG_PUBLIC} ${ARG_PRIVATE})
  endif()
endfunction()

# rolvane_paths(TARGET NAME="value" ...): defines each NAME for those sources of the target that mention it. On every
# command line, a path of this directory would keep a compiler cache from knowing a source again in another clone. A
# source that mentions one for the first time needs a new configuration.
function(rolvane_paths target)
  get_target_property(sources ${target} SOURCES)
  list(FILTER sources EXCLUDE REGEX "^\\$<")
  foreach(definition ${ARGN})
    string(REGEX MATCH "^[A-Z_]+" name "${definition}")
    foreach(source ${sources})
      get_filename_component(path ${source} ABSOLUTE)
      file(STRINGS ${path} mentions REGEX "${name}([^A-Z_]|$)" LIMIT_COUNT 1)
      if(mentions)
        set_property(SOURCE ${path} APPEND PROPERTY COMPILE_DEFINITIONS ${definition})
      endif()
    endforeach()
  endforeach()
endfunction()
