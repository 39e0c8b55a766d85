# The library proper: the three host folders and the rooms of src/GeometryVolume.
include(VlnAllocator)

vln_glob(sources
  src/Ostil/*.cpp src/Velorn/*.cpp src/vljemalloc/*.cpp src/GeometryVolume/*/*.cpp)
vln_glob(templates src/GeometryVolume/*/*.cpp.in)
vln_expand_templates(generated ${templates})
vln_glob(headers src/Ostil/*.h src/Velorn/*.h src/vljemalloc/*.h src/Reader/*.h
  src/GeometryVolume/*/*.h)

add_library(GeometryVolume ${sources} ${generated} ${headers})
add_library(GeometryVolume::GeometryVolume ALIAS GeometryVolume)
vln_target(GeometryVolume)
vln_allocator(GeometryVolume)

# The version lies in a small source of its own, written at every build and touched only when it
# changed, so that a commit recompiles one file.
set(version_source "${VLN_GENERATED_DIR}/src/GeometryVolume/core/VersionInfo.cpp")
add_custom_target(GeometryVolumeVersion
  COMMAND "${CMAKE_COMMAND}"
    "-DSOURCE_DIR=${PROJECT_SOURCE_DIR}" "-DVERSION=${PROJECT_VERSION}"
    "-DTEMPLATE=${PROJECT_SOURCE_DIR}/cmake/VersionInfo.cpp.in" "-DOUTPUT=${version_source}"
    -P "${PROJECT_SOURCE_DIR}/cmake/WriteVersion.cmake"
  BYPRODUCTS "${version_source}"
  COMMENT ""
  VERBATIM)
target_sources(GeometryVolume PRIVATE "${version_source}")
add_dependencies(GeometryVolume GeometryVolumeVersion)

# The device half is a target of its own: the options of the library's C++ are not nvcc's. The CUDA
# runtime is linked in statically, so it is no dependency of who uses the library.
if(vln_cuda)
  vln_glob(cuda_sources src/GeometryVolume/*/*.cu)
  add_library(GeometryVolumeCuda OBJECT ${cuda_sources})
  target_include_directories(GeometryVolumeCuda PRIVATE "${PROJECT_SOURCE_DIR}/src")
  set_target_properties(GeometryVolumeCuda PROPERTIES CUDA_STANDARD 17 CUDA_STANDARD_REQUIRED ON)
  target_sources(GeometryVolume PRIVATE $<TARGET_OBJECTS:GeometryVolumeCuda>)
  target_link_libraries(GeometryVolume PRIVATE $<BUILD_INTERFACE:CUDA::cudart_static>)
endif()
set_source_files_properties(src/GeometryVolume/nanovtt/CudaRuntime.cpp PROPERTIES
  COMPILE_DEFINITIONS "VLN_WITH_CUDA=$<BOOL:${vln_cuda}>")
if(VLN_SANITIZE MATCHES "thread")
  # See the source: it holds the scheduler's templates, and tells the sanitizer what they hand over.
  set_source_files_properties(src/GeometryVolume/core/Scheduler.cpp PROPERTIES
    COMPILE_OPTIONS "-fno-sanitize=thread" COMPILE_DEFINITIONS "VLN_THREAD_NOTES=1")
  # Threads give way by seed at chosen places: see src/GeometryVolume/core/YieldPointImpl.h.
  target_compile_definitions(GeometryVolume PUBLIC $<BUILD_INTERFACE:VLN_YIELD_POINTS>)
endif()

target_compile_features(GeometryVolume PUBLIC cxx_std_20)
target_include_directories(GeometryVolume PUBLIC
  "$<BUILD_INTERFACE:${PROJECT_SOURCE_DIR}/src>"
  "$<BUILD_INTERFACE:${VLN_GENERATED_DIR}>"
  "$<INSTALL_INTERFACE:${CMAKE_INSTALL_INCLUDEDIR}/GeometryVolume>")
target_link_libraries(GeometryVolume PRIVATE TBB::tbb Threads::Threads ${CMAKE_DL_LIBS})
if(NanoVDB_FOUND)
  target_include_directories(GeometryVolume SYSTEM PRIVATE "${NanoVDB_INCLUDE_DIR}")
endif()
set_target_properties(GeometryVolume PROPERTIES
  VERSION ${PROJECT_VERSION}
  SOVERSION ${PROJECT_VERSION_MAJOR}.${PROJECT_VERSION_MINOR}
  INSTALL_RPATH "$ORIGIN")
