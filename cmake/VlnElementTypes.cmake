# The element types: which are enabled, the header that says so, and the expansion of templates
# (*.cpp.in) into one source for each enabled type.

# name|C++ type. The same names and order as in src/GeometryVolume/core/ElementTypes.h.
set(VLN_ALL_ELEMENT_TYPES
  "int8|signed char"
  "uint8|unsigned char"
  "int16|short"
  "uint16|unsigned short"
  "int32|int"
  "uint32|unsigned int"
  "int64|std::int64_t"
  "uint64|std::uint64_t"
  "float|float"
  "double|double"
  "float2|Velorn::Math::float2"
  "float3|Velorn::Math::float3"
  "float4|Velorn::Math::float4"
  "double3|Velorn::Math::double3"
  "int3|Velorn::Math::int3"
  "float3x3|Velorn::Math::float3x3"
  "float4x2|Velorn::Math::float4x2"
  "float4x4|Velorn::Math::float4x4")
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

set(VLN_ELEMENT_DEFINES "")
foreach(name IN LISTS VLN_KNOWN_ELEMENT_NAMES)
  string(TOUPPER ${name} upper)
  if(name IN_LIST VLN_ENABLED_ELEMENT_NAMES)
    string(APPEND VLN_ELEMENT_DEFINES "#define VLN_HAS_ELEMENT_${upper} 1\n")
  else()
    string(APPEND VLN_ELEMENT_DEFINES "#define VLN_HAS_ELEMENT_${upper} 0\n")
  endif()
endforeach()
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
      string(REGEX REPLACE "^[^|]*\\|" "" TYPE "${entry}")
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
