# Makes one object file out of jemalloc's static library, whose every symbol bears the prefix
# vljei_ and whose only global symbols are the seven that vljemalloc.cpp calls. Linked into the
# library it cannot meet malloc, free or operator new of the process, nor another jemalloc.
#
# In: ARCHIVE, OUTPUT, AR, LD, NM, OBJCOPY.

function(run)
  execute_process(COMMAND ${ARGN} OUTPUT_VARIABLE out COMMAND_ERROR_IS_FATAL ANY)
  set(out "${out}" PARENT_SCOPE)
endfunction()

get_filename_component(folder "${OUTPUT}" DIRECTORY)
get_filename_component(stem "${OUTPUT}" NAME_WE)
file(MAKE_DIRECTORY "${folder}")
set(base "${folder}/${stem}")

# The member with the C++ operators new and delete stays out.
file(COPY_FILE "${ARCHIVE}" "${base}.a")
run("${AR}" t "${base}.a")
string(REGEX MATCHALL "[^\n]*jemalloc_cpp[^\n]*\\.o" operators "${out}")
if(operators)
  run("${AR}" d "${base}.a" ${operators})
endif()
run("${LD}" -r --whole-archive -o "${base}_all.o" "${base}.a")

run("${NM}" --defined-only --extern-only --format=posix "${base}_all.o")
string(REGEX MATCHALL "[^\n]+" lines "${out}")
set(map "")
foreach(line IN LISTS lines)
  string(REGEX REPLACE " .*" "" symbol "${line}")
  string(APPEND map "${symbol} vljei_${symbol}\n")
endforeach()
file(WRITE "${base}.map" "${map}")
run("${OBJCOPY}" "--redefine-syms=${base}.map" "${base}_all.o" "${base}_renamed.tmp")

set(keep)
foreach(function malloc aligned_alloc mallocx xallocx free mallctl malloc_stats_print)
  list(APPEND keep "--keep-global-symbol=vljei_${function}")
endforeach()
run("${OBJCOPY}" --strip-debug ${keep} "${base}_renamed.tmp" "${OUTPUT}")

# What is left undefined must not be an allocation function: that call would leave this heap.
run("${NM}" --undefined-only --format=posix "${OUTPUT}")
if(out MATCHES "(^|\n)(malloc|calloc|realloc|free|aligned_alloc|posix_memalign|memalign|[a-z]*allocx) ")
  file(REMOVE "${OUTPUT}")
  message(FATAL_ERROR "the renamed jemalloc still calls the process's ${CMAKE_MATCH_2}")
endif()
file(REMOVE "${base}.a" "${base}_all.o" "${base}_renamed.tmp")
