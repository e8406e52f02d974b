# Warning and sanitizer flags shared by every target of the project.
add_compile_options(-Wall -Wextra)
if(PLOVO_WERROR)
  add_compile_options(-Werror)
endif()

if(PLOVO_SANITIZE)
  set(_plovo_san -fsanitize=${PLOVO_SANITIZE} -fno-omit-frame-pointer)
  if(PLOVO_SANITIZE MATCHES "undefined")
    list(APPEND _plovo_san -fno-sanitize-recover=undefined)
  endif()
  add_compile_options(${_plovo_san})
  add_link_options(${_plovo_san})
endif()

# Coverage instrumentation for libFuzzer in every library the targets link.
if(PLOVO_FUZZ)
  if(NOT CMAKE_CXX_COMPILER_ID STREQUAL "Clang")
    message(FATAL_ERROR "PLOVO_FUZZ needs clang (CXX=clang++)")
  endif()
  add_compile_options(-fsanitize=fuzzer-no-link)
endif()

# plovo_library(NAME SOURCES... [LIBS ...]): one static subsystem library,
# position independent so that the module can link it.
function(plovo_library name)
  cmake_parse_arguments(ARG "" "" "SOURCES;LIBS" ${ARGN})
  add_library(${name} STATIC ${ARG_SOURCES})
  target_include_directories(${name} PUBLIC ${PROJECT_SOURCE_DIR}/include)
  target_link_libraries(${name} PUBLIC ${ARG_LIBS})
endfunction()
