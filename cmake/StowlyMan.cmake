# Renders every man/NAME.SECTION.scd into NAME.SECTION with scdoc and installs it in its
# section, so a page added to man/ needs no change here.
if(NOT SCDOC_EXECUTABLE)
  message(FATAL_ERROR "STOWLY_BUILD_MAN needs scdoc (scripts/setup installs it)")
endif()

file(GLOB man_sources CONFIGURE_DEPENDS ${PROJECT_SOURCE_DIR}/man/*.scd)
set(STOWLY_MAN_PAGES "")
foreach(source ${man_sources})
  get_filename_component(page ${source} NAME_WLE) # stowlyd.8
  string(REGEX MATCH "[0-9]$" section ${page})
  if(NOT section)
    message(FATAL_ERROR "man page source ${source} is not named NAME.SECTION.scd")
  endif()
  set(output ${PROJECT_BINARY_DIR}/man/${page})
  add_custom_command(OUTPUT ${output}
    COMMAND sh -c "\"$0\" < \"$1\" > \"$2\"" ${SCDOC_EXECUTABLE} ${source} ${output}
    DEPENDS ${source}
    COMMENT "Rendering man page ${page}"
    VERBATIM)
  list(APPEND STOWLY_MAN_PAGES ${output})
  install(FILES ${output} DESTINATION ${CMAKE_INSTALL_MANDIR}/man${section})
endforeach()
file(MAKE_DIRECTORY ${PROJECT_BINARY_DIR}/man)
add_custom_target(stowly_man ALL DEPENDS ${STOWLY_MAN_PAGES})
