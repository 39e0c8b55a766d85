# The element types: the one table of them, the header made from it, and the expansion of templates
# (*.cpp.in) into one source for each enabled type.

# name|C++ type|place in the log of the channel pool|id in flat buffers|grid type of .vdb files that
# keeps its values; - for none. GeometryVolume/core/ElementTypes.h says what each column is for.
set(VLN_ALL_ELEMENT_TYPES
  "int8|signed char|9|-|-"
  "uint8|unsigned char|14|-|-"
  "int16|short|10|3|-"
  "uint16|unsigned short|15|-|-"
  "int32|int|11|4|int32"
  "uint32|unsigned int|16|10|-"
  "int64|std::int64_t|13|5|int64"
  "uint64|std::uint64_t|17|-|-"
  "float|float|0|1|float"
  "double|double|7|2|double"
  "float2|Velorn::Math::float2|1|-|-"
  "float3|Velorn::Math::float3|2|6|vec3s"
  "float4|Velorn::Math::float4|3|17|-"
  "double3|Velorn::Math::double3|8|7|vec3d"
  "int3|Velorn::Math::int3|12|-|vec3i"
  "float3x3|Velorn::Math::float3x3|4|-|-"
  "float4x2|Velorn::Math::float4x2|5|-|-"
  "float4x4|Velorn::Math::float4x4|6|-|-")
set(VLN_QUICK_ELEMENT_TYPES float float3 double3 int32 uint8 int64)

# name|C++ type of the two tree shapes.
set(VLN_TREE_SHAPES
  "2_4|VLN::TileTree3D::Traits<2, 4, 0, 1>"
  "5_5|VLN::TileTree3D::Traits<5, 5, 0, 1>")

set(VLN_KNOWN_ELEMENT_NAMES)
foreach(entry IN LISTS VLN_ALL_ELEMENT_TYPES)
  string(REGEX REPLACE "\\|.*" "" name "${entry}")
  list(APPEND VLN_KNOWN_ELEMENT_NAMES ${name})
endforeach()

if(VLN_ELEMENT_TYPES STREQUAL "all")
  set(VLN_ENABLED_ELEMENT_NAMES ${VLN_KNOWN_ELEMENT_NAMES})
elseif(VLN_ELEMENT_TYPES STREQUAL "quick")
  set(VLN_ENABLED_ELEMENT_NAMES ${VLN_QUICK_ELEMENT_TYPES})
else()
  string(REPLACE "," ";" VLN_ENABLED_ELEMENT_NAMES "${VLN_ELEMENT_TYPES}")
  foreach(name IN LISTS VLN_ENABLED_ELEMENT_NAMES)
    if(NOT name IN_LIST VLN_KNOWN_ELEMENT_NAMES)
      message(FATAL_ERROR "VLN_ELEMENT_TYPES names '${name}'; known are: ${VLN_KNOWN_ELEMENT_NAMES}")
    endif()
  endforeach()
  if(NOT VLN_ENABLED_ELEMENT_NAMES)
    message(FATAL_ERROR "VLN_ELEMENT_TYPES is empty; use all, quick or a list of names")
  endif()
endif()

if(VLN_BUILD_INTEROP)
  foreach(name IN LISTS VLN_QUICK_ELEMENT_TYPES)
    if(NOT name IN_LIST VLN_ENABLED_ELEMENT_NAMES)
      message(FATAL_ERROR "VLN_ELEMENT_TYPES lacks '${name}': files bring at least "
        "${VLN_QUICK_ELEMENT_TYPES}; add it, or set VLN_BUILD_INTEROP=OFF")
    endif()
  endforeach()
endif()

# The lists of the header: X-macros, one row a line.
set(VLN_ELEMENT_DEFINES "")
set(VLN_KNOWN_ROWS "")
set(VLN_ENABLED_ROWS "")
set(flat_rows)
foreach(entry IN LISTS VLN_ALL_ELEMENT_TYPES)
  string(REPLACE "|" ";" entry "${entry}")
  list(GET entry 0 name)
  list(GET entry 1 type)
  list(GET entry 2 pool)
  list(GET entry 3 flat)
  list(GET entry 4 vdb)
  string(TOUPPER ${name} upper)
  set(flat_id ${flat})
  if(flat STREQUAL "-")
    set(flat_id 0)
  endif()
  string(REPLACE "-" "" vdb "${vdb}")
  string(APPEND VLN_KNOWN_ROWS " \\\n  X(${type}, ${name}, ${pool}, ${flat_id}, \"${vdb}\")")
  if(NOT name IN_LIST VLN_ENABLED_ELEMENT_NAMES)
    string(APPEND VLN_ELEMENT_DEFINES "#define VLN_HAS_ELEMENT_${upper} 0\n#define VLN_ELEMENT_${upper}(X)\n")
    continue()
  endif()
  string(APPEND VLN_ELEMENT_DEFINES
    "#define VLN_HAS_ELEMENT_${upper} 1\n#define VLN_ELEMENT_${upper}(X) X(${type}, ${name})\n")
  string(APPEND VLN_ENABLED_ROWS " \\\n  VLN_ELEMENT_${upper}(X)")
  if(flat_id)
    list(APPEND flat_rows "${flat_id}|VLN_ELEMENT_${upper}(X)")
  endif()
endforeach()
list(SORT flat_rows COMPARE NATURAL)
list(TRANSFORM flat_rows REPLACE "^[0-9]+.(.*)" " \\\\\n  \\1" OUTPUT_VARIABLE VLN_FLAT_ROWS)
string(REPLACE ";" "" VLN_FLAT_ROWS "${VLN_FLAT_ROWS}")
configure_file("${PROJECT_SOURCE_DIR}/cmake/ElementTypesConfig.h.in"
  "${VLN_GENERATED_DIR}/GeometryVolume/core/ElementTypesConfig.h" @ONLY)

# vln_expand_templates(OUT FILE...): for each template one source per enabled element type, with
# @TYPE@ and @TYPE_NAME@ filled in. A template that mentions @TRAITS@ gets one source per type and
# tree shape, with @TRAITS@ and @TRAITS_NAME@ filled in too; one that does not serves both shapes
# in the same source.
function(vln_expand_templates out)
  set(result)
  foreach(template IN LISTS ARGN)
    file(RELATIVE_PATH relative "${PROJECT_SOURCE_DIR}" "${template}")
    get_filename_component(folder "${relative}" DIRECTORY)
    get_filename_component(stem "${relative}" NAME)
    string(REGEX REPLACE "\\.cpp\\.in$" "" stem "${stem}")
    file(STRINGS "${template}" uses_traits REGEX "@TRAITS(_NAME)?@" LIMIT_COUNT 1)
    if(uses_traits)
      set(shapes ${VLN_TREE_SHAPES})
    else()
      set(shapes "|")
    endif()
    foreach(entry IN LISTS VLN_ALL_ELEMENT_TYPES)
      string(REGEX REPLACE "\\|.*" "" TYPE_NAME "${entry}")
      string(REGEX REPLACE "^[^|]*\\|([^|]*)\\|.*" "\\1" TYPE "${entry}")
      if(NOT TYPE_NAME IN_LIST VLN_ENABLED_ELEMENT_NAMES)
        continue()
      endif()
      foreach(shape IN LISTS shapes)
        string(REGEX REPLACE "\\|.*" "" TRAITS_NAME "${shape}")
        string(REGEX REPLACE "^[^|]*\\|" "" TRAITS "${shape}")
        set(suffix ${TYPE_NAME})
        if(TRAITS_NAME)
          set(suffix ${TRAITS_NAME}_${TYPE_NAME})
        endif()
        set(source "${VLN_GENERATED_DIR}/${folder}/${stem}_${suffix}.cpp")
        configure_file("${template}" "${source}" @ONLY)
        list(APPEND result "${source}")
      endforeach()
    endforeach()
  endforeach()
  set(${out} "${result}" PARENT_SCOPE)
endfunction()
