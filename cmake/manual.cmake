# Manual pages and shell completions, made at build time by the programs from what they say with
# --help, from the headers, and from docs/.
set(pages ${PROJECT_BINARY_DIR}/manual)
set(completions ${PROJECT_BINARY_DIR}/completions)
file(MAKE_DIRECTORY ${pages} ${completions})

set(stamps ${PROJECT_BINARY_DIR}/manual.stamp)
set(headers_command "")
set(headers "")
foreach(entry IN LISTS fileindex_installed_headers)
  string(REPLACE "|" ";" entry ${entry})
  list(GET entry 0 folder)
  list(GET entry 1 header)
  list(APPEND headers ${folder}/${header})
  list(APPEND headers_command COMMAND fileindex_manual header ${header} ${folder}/${header} ${pages})
endforeach()
add_custom_command(OUTPUT ${stamps}
  COMMAND fileindex_manual tool ${pages}
  COMMAND fileindex_manual completions ${completions}
  ${headers_command}
  COMMAND ${CMAKE_COMMAND} -E touch ${stamps}
  DEPENDS fileindex_manual ${headers} COMMENT "Manual pages of the tool and the library" VERBATIM)

foreach(daemon evnotifyd fileindexd kavocontentextractd kavoelasticd)
  add_custom_command(OUTPUT ${pages}/${daemon}.8
    COMMAND ${daemon} --help | $<TARGET_FILE:fileindex_manual> daemon ${daemon} ${pages}
    DEPENDS fileindex_manual ${daemon} VERBATIM)
  list(APPEND stamps ${pages}/${daemon}.8)
endforeach()

find_program(FILEINDEX_LOWDOWN lowdown)
if(FILEINDEX_LOWDOWN)
  foreach(page engine.5 queue.5 shares.5 state.5 extract.7 indexing.7 notify.7 operations.7 policy.7
               troubleshooting.7)
    string(REGEX MATCH "^[a-z]+" name ${page})
    string(REGEX MATCH "[0-9]$" section ${page})
    set(output ${pages}/fileindex-${page})
    # The document's title is what the page is about. Bold does for the fixed width that terminals have anyway.
    add_custom_command(OUTPUT ${output}
      COMMAND sh -c "{ printf '# NAME\\n\\n%s - %s\\n\\n' \"$2\" \"$(sed -n '1s/^# //p' \"$4\")\"; sed '1s/.*/# DESCRIPTION/' \"$4\"; } | \"$1\" -s -tman --out-no-smarty -M title=\"$2\" -M section=\"$3\" -M source=fileindex -M volume=fileindex | sed 's/\\\\fC/\\\\fB/g' > \"$5\""
              sh ${FILEINDEX_LOWDOWN} fileindex-${name} ${section} ${PROJECT_SOURCE_DIR}/docs/${name}.md ${output}
      DEPENDS ${PROJECT_SOURCE_DIR}/docs/${name}.md VERBATIM)
    list(APPEND stamps ${output})
  endforeach()
else()
  message(STATUS "lowdown is not installed: the manual pages of sections 5 and 7 are left out")
endif()

add_custom_target(manual ALL DEPENDS ${stamps})
foreach(section 1 3 5 7 8)
  install(DIRECTORY ${pages}/ DESTINATION ${CMAKE_INSTALL_MANDIR}/man${section}
    FILES_MATCHING PATTERN "*.${section}")
endforeach()
install(FILES ${completions}/fileindex.bash RENAME fileindex
  DESTINATION ${CMAKE_INSTALL_DATADIR}/bash-completion/completions)
install(FILES ${completions}/_fileindex DESTINATION ${CMAKE_INSTALL_DATADIR}/zsh/vendor-completions)
install(FILES ${completions}/fileindex.fish
  DESTINATION ${CMAKE_INSTALL_DATADIR}/fish/vendor_completions.d)
