# The library's areas and what each may see. The layering is
#   tools, service -> rsync (sending side), receiver -> sync -> host -> net -> platform -> core
# and the build enforces it: each area is a static archive compiled against a view of its own
# (<build>/layers/<area>/) that holds the public headers (include/s2s_*.h) of that area and of the
# areas below it, and one link named after each of those areas to its folder, so that the
# "area/file.h" form of an internal header resolves only for the area itself and the areas below.
# A header of a higher or neighbouring area is simply not found.
#
# New source and internal header files need no edit here. A new public header needs an owner in
# the table below (configuring fails until it has one).

# Bottom first: an area sees every area listed before it.
set(S2S_AREAS core platform net host sync)
# The two areas on top of sync are neighbours that do not see each other.
set(S2S_TOP_AREAS rsync receiver)

set(S2S_AREA_HEADERS_core s2s_export.h s2s_pobject.h s2s_logger.h)
set(S2S_AREA_HEADERS_platform s2s_platform.h)
set(S2S_AREA_HEADERS_net s2s_status.h s2s_channel.h s2s_stream.h s2s_ipc.h)
set(S2S_AREA_HEADERS_host s2s_host.h s2s_control.h s2s_control_client.h s2s_server.h)
set(S2S_AREA_HEADERS_sync s2s_sync_obj.h)
set(S2S_AREA_HEADERS_rsync s2s_rsync_wrapper.h s2s_rsyncer.h s2s_source_guard.h s2s_task_run.h)
set(S2S_AREA_HEADERS_receiver s2s_receiver.h)
# The umbrella for programs that use the library: it belongs to no area, so no area includes it.
set(S2S_UMBRELLA_HEADERS s2s.h)

# Files of a neighbour an area still reaches into (area:path), each a known debt listed so it
# stays visible. None today.
set(S2S_LAYER_EXCEPTIONS)

set(S2S_LIBRARY_AREAS ${S2S_AREAS} ${S2S_TOP_AREAS})
set(_s2s_owned ${S2S_UMBRELLA_HEADERS})
foreach(area IN LISTS S2S_LIBRARY_AREAS)
  list(APPEND _s2s_owned ${S2S_AREA_HEADERS_${area}})
endforeach()
foreach(header IN LISTS S2S_PUBLIC_HEADERS)
  get_filename_component(name ${header} NAME)
  if(NOT name IN_LIST _s2s_owned)
    message(FATAL_ERROR "include/${name} belongs to no area: add it to the area that implements "
                        "it in cmake/layers.cmake")
  endif()
endforeach()

# Fills <build>/layers/<name>/ with links to the given areas' folders and public headers, and to
# the listed extra files; whatever an earlier configure left there and is no longer listed goes.
function(s2s_make_view name)
  cmake_parse_arguments(PARSE_ARGV 1 arg "" "" "AREAS;FILES")
  set(view ${PROJECT_BINARY_DIR}/layers/${name})
  set(wanted)
  foreach(area IN LISTS arg_AREAS)
    list(APPEND wanted ${area})
    foreach(header IN LISTS S2S_AREA_HEADERS_${area})
      list(APPEND wanted ${header})
    endforeach()
  endforeach()
  foreach(file IN LISTS arg_FILES)
    if(EXISTS ${PROJECT_SOURCE_DIR}/${file} OR EXISTS ${PROJECT_SOURCE_DIR}/include/${file})
      list(APPEND wanted ${file})
    endif()
  endforeach()
  # Remove stale entries one by one (never recursively: the entries are links into the sources).
  file(GLOB_RECURSE present LIST_DIRECTORIES false RELATIVE ${view} ${view}/*)
  file(GLOB present_top LIST_DIRECTORIES true RELATIVE ${view} ${view}/*)
  foreach(entry IN LISTS present present_top)
    if(NOT entry IN_LIST wanted AND IS_SYMLINK ${view}/${entry})
      file(REMOVE ${view}/${entry})
    endif()
  endforeach()
  foreach(entry IN LISTS wanted)
    if(EXISTS ${PROJECT_SOURCE_DIR}/include/${entry})
      set(target ${PROJECT_SOURCE_DIR}/include/${entry})
    else()
      set(target ${PROJECT_SOURCE_DIR}/${entry})
    endif()
    get_filename_component(parent ${view}/${entry} DIRECTORY)
    file(MAKE_DIRECTORY ${parent})
    file(CREATE_LINK ${target} ${view}/${entry} SYMBOLIC)
  endforeach()
endfunction()

# One static archive per area: position independent (it goes into the shared library whole),
# hidden symbols, compiled against its view alone.
set(S2S_AREA_TARGETS)
set(_s2s_below)
foreach(area IN LISTS S2S_LIBRARY_AREAS)
  set(extra)
  foreach(exception IN LISTS S2S_LAYER_EXCEPTIONS)
    if(exception MATCHES "^${area}:(.*)$")
      list(APPEND extra ${CMAKE_MATCH_1})
    endif()
  endforeach()
  s2s_make_view(${area} AREAS ${_s2s_below} ${area} FILES ${extra})
  if(NOT area IN_LIST S2S_TOP_AREAS)
    list(APPEND _s2s_below ${area})
  endif()

  file(GLOB sources CONFIGURE_DEPENDS ${PROJECT_SOURCE_DIR}/${area}/*.cpp
       ${PROJECT_SOURCE_DIR}/${area}/*.c)
  add_library(s2s_${area} STATIC ${sources})
  set_target_properties(s2s_${area} PROPERTIES POSITION_INDEPENDENT_CODE ON
                        CXX_VISIBILITY_PRESET hidden C_VISIBILITY_PRESET hidden
                        VISIBILITY_INLINES_HIDDEN ON)
  target_compile_definitions(s2s_${area} PRIVATE S2S_BUILDING_LIBRARY)
  target_include_directories(s2s_${area} PRIVATE ${PROJECT_BINARY_DIR}/layers/${area})
  target_link_libraries(s2s_${area} PRIVATE Boost::headers OpenSSL::SSL OpenSSL::Crypto
                                            Threads::Threads)
  list(APPEND S2S_AREA_TARGETS s2s_${area})
endforeach()

# A program on top (service/, tools/) sees every public header (through the library's interface)
# and, besides its own folder, only the folders listed.
s2s_make_view(service FILES service)
s2s_make_view(tools FILES service tools platform/records.h)

# Checks that the views hold: a unit compiled with an area's own include path finds the headers it
# may use and misses those of higher areas (core including the platform's public or internal
# header). Each check compiles one line, syntax only.
function(s2s_add_layering_tests)
  set(checks "CoreSeesItsOwnHeaders:core:s2s_pobject.h"
             "CoreCannotIncludePlatform:core:s2s_platform.h"
             "CoreCannotIncludePlatformInternals:core:platform/section_file.h")
  foreach(check IN LISTS checks)
    string(REPLACE ":" ";" fields ${check})
    list(GET fields 0 name)
    list(GET fields 1 area)
    list(GET fields 2 header)
    set(unit ${PROJECT_BINARY_DIR}/layering/${name}.cpp)
    file(WRITE ${unit} "#include \"${header}\"\n")
    add_test(NAME layering.${name}
             COMMAND ${CMAKE_CXX_COMPILER} -std=c++17 -fsyntax-only
                     "-I$<JOIN:$<TARGET_PROPERTY:s2s_${area},INCLUDE_DIRECTORIES>,;-I>" ${unit}
             COMMAND_EXPAND_LISTS)
    if(name MATCHES "Cannot")
      set_tests_properties(layering.${name} PROPERTIES
                           PASS_REGULAR_EXPRESSION "${header}: No such file or directory")
    endif()
    set_tests_properties(layering.${name} PROPERTIES LABELS layering TIMEOUT 60)
  endforeach()
endfunction()
