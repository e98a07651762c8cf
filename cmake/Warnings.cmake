# Every target in the project compiles with the same strict warnings. Turning
# them into errors is the developers' and CI's choice (scripts/test and
# .ci/run turn it on): a packager's build with another compiler or
# optimisation level must not fail on a warning that compiler adds.
option(QUORVEL_WERROR "Treat compiler warnings as errors" OFF)
add_compile_options(-Wall -Wextra -Wno-missing-field-initializers)
if(QUORVEL_WERROR)
  add_compile_options(-Werror)
endif()
if(CMAKE_BUILD_TYPE STREQUAL "Debug" OR QUORVEL_DCHECK OR QUORVEL_SANITIZE)
  add_compile_definitions(QUORVEL_DCHECK_IS_ON=1)
endif()

# quorvel_add_library(NAME) builds every .cpp below the calling folder (except
# those listed in EXCLUDE) into a static library whose headers are included as
# "Folder/Header.h" from the repository root.
function(quorvel_add_library name)
  cmake_parse_arguments(ARG "" "" "EXCLUDE" ${ARGN})
  file(GLOB_RECURSE sources CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/*.cpp)
  foreach(excluded IN LISTS ARG_EXCLUDE)
    list(REMOVE_ITEM sources ${CMAKE_CURRENT_SOURCE_DIR}/${excluded})
  endforeach()
  if(sources)
    add_library(${name} STATIC ${sources})
    target_include_directories(${name} PUBLIC ${PROJECT_SOURCE_DIR})
    set(QUORVEL_LIBRARY_SCOPE PUBLIC PARENT_SCOPE)
  else()
    add_library(${name} INTERFACE)
    target_include_directories(${name} INTERFACE ${PROJECT_SOURCE_DIR})
    set(QUORVEL_LIBRARY_SCOPE INTERFACE PARENT_SCOPE)
  endif()
endfunction()
