# Man pages: every docs/man/NAME.SECTION.md is rendered to roff with pandoc at build
# time (build/man/NAME.SECTION, then gzipped for installing) and installed with the daemon.
find_program(PANDOC_EXECUTABLE pandoc)
file(GLOB vessel_man_sources CONFIGURE_DEPENDS ${CMAKE_SOURCE_DIR}/docs/man/*.md)
if(NOT PANDOC_EXECUTABLE)
  message(WARNING "pandoc not found (scripts/setup installs it): the man pages are not built")
  return()
endif()
set(vessel_man_pages)
foreach(source ${vessel_man_sources})
  get_filename_component(page ${source} NAME_WLE)  # vesseld.8
  if(NOT page MATCHES "\\.([1-8])$")
    message(WARNING "docs/man/${page}.md: name it NAME.SECTION.md to have it rendered")
    continue()
  endif()
  set(section ${CMAKE_MATCH_1})
  set(roff ${CMAKE_BINARY_DIR}/man/${page})
  add_custom_command(OUTPUT ${roff} ${roff}.gz
    COMMAND ${PANDOC_EXECUTABLE} --standalone --to man ${source} -o ${roff}
    COMMAND gzip -9n -f -k ${roff}
    DEPENDS ${source}
    COMMENT "Rendering man page ${page}"
    VERBATIM)
  list(APPEND vessel_man_pages ${roff} ${roff}.gz)
  install(FILES ${roff}.gz DESTINATION share/man/man${section} COMPONENT daemon)
endforeach()
add_custom_target(man ALL DEPENDS ${vessel_man_pages})
