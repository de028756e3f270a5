# The library's layers, bottom to top.  A unit (a .h and its .cpp, named by
# its path below src/ without extension) may use the units of its own layer
# and of the layers below, never one above: a back-edge is how ten modules
# once ended in one include cycle.  Two checks hold the order in every build:
#
#   includes  cmake/check_layers.cmake runs first in `all` and fails on a
#             source or header that includes a header of a higher layer,
#             naming the file and the include;
#   symbols   each layer is linked once more as a shared object of its own
#             objects and the static libraries of the layers below only,
#             with -Wl,--no-undefined: a call into a higher layer is an
#             undefined reference there.
#
# Every .h and .cpp under src/ must be placed in exactly one layer; an
# unplaced file is a configure error, so a new unit is placed when it is
# added.  A unit named here whose files do not exist yet is passed over.
#
# The layers are internal: tests, tools and hosts link the one library
# (fscanner / fscanner_static) made from all their objects.

set(FSCANNER_LAYERS base platform text language store records paths walk cache)

# The host's services: allocator, String, configuration, CPU throttle, trace.
set(FSCANNER_LAYER_base
  base/CpuThreshold base/KelCfg base/QvLogWrapper base/String base/kelmem)

# The operating system: the Env door, files and the factory, locks, the clock
# and wide/narrow conversions.
set(FSCANNER_LAYER_platform
  fscanner/fscommon/env fscanner/fscommon/env_posix
  fscanner/fscommon/sysfile fscanner/fscommon/sysfactory
  fscanner/fscommon/sync fscanner/fscommon/trace fscanner/fscommon/utils)

# Text and values without meaning to the engine: string and wildcard helpers,
# the byte codec, checksums, typed fields, the owned string list, the
# absolute form of a path.
set(FSCANNER_LAYER_text
  fscanner/fscommon/stringhelper fscanner/fscommon/wildcard
  fscanner/fscommon/codec fscanner/fscommon/checksum fscanner/fscommon/fields
  fscanner/fscommon/strlist fscanner/fscommon/resolvepath)

# The expression language: lexer, parser and values (one cycle inside the
# layer: values run commands of the analyzer), criteria, known-hash sets.
set(FSCANNER_LAYER_language
  fscanner/fscommon/lexer fscanner/fscommon/expvalue
  fscanner/fscommon/syntaxanalyzer fscanner/fscommon/syntaxfail fscanner/fscommon/criteria
  fscanner/fscommon/filehash)

# The record store: table files, indexes, cursors, compaction, the natural
# merge sort on files, and the names and side files of a cache directory
# (tables take their file names from there).  Cursors evaluate criteria, so
# the store sits above the language.
set(FSCANNER_LAYER_store
  fscanner/fscommon/table fscanner/fscommon/table_compact
  fscanner/fscommon/table_verify fscanner/fscommon/table_format fscanner/fscommon/keyhash
  fscanner/fscommon/recordset fscanner/fscommon/naturalmerge
  fscanner/fscommon/cache_files)

# The public records, result sets and result files, the loader, the query
# statistics record.
set(FSCANNER_LAYER_records
  fscanner/fs/fs_fileinfo fscanner/fs/fs_resultset fscanner/fs/fs_serializer
  fscanner/fs/fs_resultset_file fscanner/fs/fs_resultset_sort
  fscanner/fs/fs_loader fscanner/fscommon/querystats)

# Paths and drives: path lists and the resolver, the drive list from the
# mount table and automounter maps, and the query that carries paths.
set(FSCANNER_LAYER_paths
  fscanner/fscommon/pathhelper fscanner/fscommon/drivehelper
  fscanner/fscommon/mountlist fscanner/fscommon/automounter
  fscanner/fs/fs_query)

# File inspection and the direct walk.
set(FSCANNER_LAYER_walk
  fscanner/fscommon/filetypehelper fscanner/fscommon/fileprocessor
  fscanner/fscommon/fsbuild fscanner/fscommon/walk)

# The cache engine (directory and file tables, scan, query driver,
# extraction, cache files) and the cache objects of the host.
set(FSCANNER_LAYER_cache
  fscanner/fscommon/cachebase fscanner/fscommon/cache2
  fscanner/fscommon/cache_common fscanner/fscommon/cache_extract
  fscanner/fscommon/cache_scan fscanner/fscommon/cachetables
  fscanner/fscommon/cache_querystats)

# --- the files of each layer --------------------------------------------------
#
# Sets FSCANNER_LAYER_<layer>_SOURCES (absolute .cpp paths) and
# FSCANNER_LAYER_<layer>_FILES (every .h and .cpp, relative to src/), and
# fails on a file under src/ that no layer holds or two layers name.
set(FSCANNER_SRC_DIR ${CMAKE_SOURCE_DIR}/src)
set(placed "")
foreach(layer ${FSCANNER_LAYERS})
  set(FSCANNER_LAYER_${layer}_SOURCES "")
  set(FSCANNER_LAYER_${layer}_FILES "")
  foreach(unit ${FSCANNER_LAYER_${layer}})
    foreach(ext h cpp)
      set(file ${unit}.${ext})
      if(EXISTS ${FSCANNER_SRC_DIR}/${file})
        if(file IN_LIST placed)
          message(FATAL_ERROR "cmake/layers.cmake: src/${file} is placed in two layers")
        endif()
        list(APPEND placed ${file})
        list(APPEND FSCANNER_LAYER_${layer}_FILES ${file})
        if(ext STREQUAL "cpp")
          list(APPEND FSCANNER_LAYER_${layer}_SOURCES ${FSCANNER_SRC_DIR}/${file})
        endif()
      endif()
    endforeach()
  endforeach()
endforeach()

file(GLOB_RECURSE all_files CONFIGURE_DEPENDS RELATIVE ${FSCANNER_SRC_DIR}
     ${FSCANNER_SRC_DIR}/*.cpp ${FSCANNER_SRC_DIR}/*.h)
set(unplaced "")
foreach(file ${all_files})
  if(NOT file IN_LIST placed)
    list(APPEND unplaced "src/${file}")
  endif()
endforeach()
if(unplaced)
  list(JOIN unplaced "\n  " unplaced_text)
  message(FATAL_ERROR "These files belong to no layer of the library; place each "
          "unit in one layer of cmake/layers.cmake:\n  ${unplaced_text}")
endif()

# The placement as the include check reads it at build time.
set(layer_table "set(FSCANNER_LAYERS ${FSCANNER_LAYERS})\n")
foreach(layer ${FSCANNER_LAYERS})
  string(APPEND layer_table "set(FSCANNER_LAYER_${layer}_FILES ${FSCANNER_LAYER_${layer}_FILES})\n")
endforeach()
file(CONFIGURE OUTPUT ${CMAKE_BINARY_DIR}/layers/placement.cmake CONTENT "${layer_table}")

set(includes_stamp ${CMAKE_BINARY_DIR}/layers/includes.stamp)
set(checked_files "")
foreach(file ${placed})
  list(APPEND checked_files ${FSCANNER_SRC_DIR}/${file})
endforeach()
add_custom_command(OUTPUT ${includes_stamp}
  COMMAND ${CMAKE_COMMAND} -DPLACEMENT=${CMAKE_BINARY_DIR}/layers/placement.cmake
          -DSOURCE_DIR=${FSCANNER_SRC_DIR} -DSTAMP=${includes_stamp}
          -P ${CMAKE_SOURCE_DIR}/cmake/check_layers.cmake
  DEPENDS ${checked_files} ${CMAKE_BINARY_DIR}/layers/placement.cmake
          ${CMAKE_SOURCE_DIR}/cmake/check_layers.cmake
  COMMENT "Checking that no unit includes a header of a higher layer"
  VERBATIM)
add_custom_target(fscanner_layer_includes ALL DEPENDS ${includes_stamp})

# --- one object library, one static library and one link check per layer ------
#
# The link check is left out when the build is instrumented by a sanitizer or
# for fuzzing: their runtimes are left undefined in shared objects (clang), and
# the plain build checks the same objects.
set(FSCANNER_LAYER_LINK_CHECK ON)
if(CMAKE_CXX_FLAGS MATCHES "-fsanitize")
  set(FSCANNER_LAYER_LINK_CHECK OFF)
endif()

set(FSCANNER_LAYER_OBJECTS "")
set(lower "")
foreach(layer ${FSCANNER_LAYERS})
  add_library(fscanner_${layer}_objs OBJECT ${FSCANNER_LAYER_${layer}_SOURCES})
  target_include_directories(fscanner_${layer}_objs PUBLIC ${FSCANNER_SRC_DIR})
  add_dependencies(fscanner_${layer}_objs fscanner_layer_includes)

  add_library(fscanner_${layer} STATIC $<TARGET_OBJECTS:fscanner_${layer}_objs>)
  set_target_properties(fscanner_${layer} PROPERTIES
    ARCHIVE_OUTPUT_DIRECTORY ${CMAKE_BINARY_DIR}/layers)
  target_link_libraries(fscanner_${layer} PUBLIC ${lower} Threads::Threads ${CMAKE_DL_LIBS})

  if(FSCANNER_LAYER_LINK_CHECK)
    add_library(fscanner_${layer}_check SHARED $<TARGET_OBJECTS:fscanner_${layer}_objs>)
    set_target_properties(fscanner_${layer}_check PROPERTIES
      LIBRARY_OUTPUT_DIRECTORY ${CMAKE_BINARY_DIR}/layers)
    target_link_libraries(fscanner_${layer}_check PRIVATE ${lower} Threads::Threads ${CMAKE_DL_LIBS})
    target_link_options(fscanner_${layer}_check PRIVATE -Wl,--no-undefined)
  endif()

  list(APPEND FSCANNER_LAYER_OBJECTS $<TARGET_OBJECTS:fscanner_${layer}_objs>)
  set(lower fscanner_${layer})
endforeach()
