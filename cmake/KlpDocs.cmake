# Man pages and bash completion, made at build time by docgen from the
# programs' own tables (see cmake/docgen.cpp) into man/ and completion/ of
# the build tree.
add_executable(klp_docgen ${CMAKE_SOURCE_DIR}/cmake/docgen.cpp)
target_link_libraries(klp_docgen PRIVATE klp_static)

set(KLP_MAN_PAGES klpkccmd.1 klptrc.1 klpkcap.1 klptrcbp.1 klpapi.3)
set(KLP_COMPLETIONS klpkccmd klptrc)
set(KLP_DOC_OUTPUTS "")
foreach(page ${KLP_MAN_PAGES})
  list(APPEND KLP_DOC_PAIRS docs/man/${page}.in man/${page})
endforeach()
foreach(prog ${KLP_COMPLETIONS})
  list(APPEND KLP_DOC_PAIRS completion/${prog}.in completion/${prog})
endforeach()
while(KLP_DOC_PAIRS)
  list(POP_FRONT KLP_DOC_PAIRS in out)
  add_custom_command(OUTPUT ${CMAKE_BINARY_DIR}/${out}
    COMMAND klp_docgen ${CMAKE_SOURCE_DIR}/${in} ${CMAKE_BINARY_DIR}/${out}
            VERSION=${PROJECT_VERSION} DATADIR=${CMAKE_INSTALL_FULL_DATADIR}
    DEPENDS klp_docgen ${CMAKE_SOURCE_DIR}/${in}
    COMMENT "Generating ${out}" VERBATIM)
  list(APPEND KLP_DOC_OUTPUTS ${CMAKE_BINARY_DIR}/${out})
endwhile()
file(MAKE_DIRECTORY ${CMAKE_BINARY_DIR}/man ${CMAKE_BINARY_DIR}/completion)
# `man klpGetStatus` and the like show klpapi(3).
foreach(fn klpStartProgram klpStopProgram klpGetStatusSize klpGetStatus _klpTrace)
  file(WRITE ${CMAKE_BINARY_DIR}/man/${fn}.3 ".so man3/klpapi.3\n")
  list(APPEND KLP_MAN_PAGES ${fn}.3)
endforeach()
add_custom_target(klp_docs ALL DEPENDS ${KLP_DOC_OUTPUTS})
