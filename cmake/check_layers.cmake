# The include half of the layer check (see cmake/layers.cmake), run as
#   cmake -DPLACEMENT=<build>/layers/placement.cmake -DSOURCE_DIR=<src>
#         -DSTAMP=<stamp file> -P check_layers.cmake
# Fails, naming every file and include, when a unit includes a header of a
# layer above its own; touches STAMP when none does.  An include is looked up
# below src/ first, then beside the including file; one that names no file of
# the library (a system header) is not the check's business.

include(${PLACEMENT})

set(rank 0)
foreach(layer ${FSCANNER_LAYERS})
  foreach(file ${FSCANNER_LAYER_${layer}_FILES})
    set("rank_of_${file}" ${rank})
    set("layer_of_${file}" ${layer})
  endforeach()
  math(EXPR rank "${rank} + 1")
endforeach()

set(violations "")
foreach(layer ${FSCANNER_LAYERS})
  foreach(file ${FSCANNER_LAYER_${layer}_FILES})
    set(own_rank ${rank_of_${file}})
    get_filename_component(dir ${file} DIRECTORY)
    file(STRINGS ${SOURCE_DIR}/${file} lines REGEX "^[ \t]*#[ \t]*include[ \t]*[\"<]")
    foreach(line ${lines})
      if(NOT line MATCHES "#[ \t]*include[ \t]*[\"<]([^\">]+)[\">]")
        continue()
      endif()
      set(included ${CMAKE_MATCH_1})
      set(target "")
      if(DEFINED "rank_of_${included}")
        set(target ${included})
      elseif(dir AND DEFINED "rank_of_${dir}/${included}")
        set(target ${dir}/${included})
      endif()
      if(target STREQUAL "")
        continue()
      endif()
      if(rank_of_${target} GREATER own_rank)
        list(APPEND violations
             "src/${file} (layer ${layer}) includes \"${included}\" of the higher layer ${layer_of_${target}}")
      endif()
    endforeach()
  endforeach()
endforeach()

if(violations)
  list(JOIN violations "\n  " text)
  list(JOIN FSCANNER_LAYERS " < " order)
  message(FATAL_ERROR "Layer order broken (${order}):\n  ${text}\n"
          "Move the shared piece down, or pass a callback, instead of reaching up.")
endif()
file(TOUCH ${STAMP})
