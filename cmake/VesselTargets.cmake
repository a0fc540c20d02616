# Every directory's sources are picked up by glob so that adding a class pair
# needs no build edit; CONFIGURE_DEPENDS re-globs on each build.
function(vessel_sources out)
  set(files)
  foreach(dir ${ARGN})
    file(GLOB_RECURSE found CONFIGURE_DEPENDS ${dir}/*.cpp ${dir}/*.c)
    list(APPEND files ${found})
  endforeach()
  set(${out} ${files} PARENT_SCOPE)
endfunction()

function(vessel_warnings target)
  target_compile_options(${target} PRIVATE ${VESSEL_WARNINGS})
endfunction()
