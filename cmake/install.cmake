# What is installed. The tree may be moved as a whole afterwards: everything in it finds the rest from
# where it stands itself.
include(CMakePackageConfigHelpers)

set(fileindex_headers ${CMAKE_INSTALL_INCLUDEDIR}/vexlo)
set(fileindex_package ${CMAKE_INSTALL_LIBDIR}/cmake/fileindex)

# fileindex_install_headers(FOLDER SUBFOLDER): the headers below FOLDER/SUBFOLDER, at the path from
# FOLDER that their includes are spelled with; without those whose first comment says "Not installed."
set(fileindex_installed_headers "")
function(fileindex_install_headers folder subfolder)
  file(GLOB_RECURSE headers RELATIVE ${folder} CONFIGURE_DEPENDS ${folder}/${subfolder}/*.h)
  foreach(header IN LISTS headers)
    file(READ ${folder}/${header} text)
    string(REGEX MATCH "^(//[^\n]*\n)+" comment "${text}")
    string(FIND "${comment}" "Not installed." marked)
    if(marked EQUAL -1)
      get_filename_component(place ${header} DIRECTORY)
      install(FILES ${folder}/${header} DESTINATION ${fileindex_headers}/${place})
      list(APPEND fileindex_installed_headers ${folder}|${header})
    endif()
  endforeach()
  set(fileindex_installed_headers ${fileindex_installed_headers} PARENT_SCOPE)
endfunction()

fileindex_install_headers(${PROJECT_SOURCE_DIR}/src/include common)
fileindex_install_headers(${PROJECT_SOURCE_DIR}/src fileindex)

set(fileindex_libraries fileindex)
if(TARGET kavoplatform)
  fileindex_install_headers(${PROJECT_SOURCE_DIR}/platform/include kavo)
  list(APPEND fileindex_libraries kavoplatform)
  # An exported target must not name the source tree.
  set_property(TARGET kavoplatform PROPERTY INTERFACE_INCLUDE_DIRECTORIES
    $<BUILD_INTERFACE:${PROJECT_SOURCE_DIR}/platform/include>
    $<INSTALL_INTERFACE:${fileindex_headers}>)
endif()

file(RELATIVE_PATH fileindex_bin_to_lib
  ${CMAKE_INSTALL_FULL_BINDIR} ${CMAKE_INSTALL_FULL_LIBDIR})
set_property(TARGET ${fileindex_libraries} PROPERTY INSTALL_RPATH "$ORIGIN")
foreach(program evnotifyd fileindex_cli fileindexd kavocontentextractd kavoelasticd)
  if(TARGET ${program})
    set_property(TARGET ${program} PROPERTY INSTALL_RPATH "$ORIGIN/${fileindex_bin_to_lib}")
    install(TARGETS ${program} RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR})
  endif()
endforeach()

if(fileindex_is_local)
  file(GLOB fileindex_units CONFIGURE_DEPENDS ${PROJECT_SOURCE_DIR}/packaging/systemd/*)
  install(FILES ${fileindex_units} DESTINATION lib/systemd/system)
  install(FILES ${PROJECT_SOURCE_DIR}/packaging/sysusers.d/fileindex.conf DESTINATION lib/sysusers.d)
endif()

install(TARGETS ${fileindex_libraries} EXPORT fileindexTargets
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR})
install(EXPORT fileindexTargets NAMESPACE fileindex:: DESTINATION ${fileindex_package})

write_basic_package_version_file(${PROJECT_BINARY_DIR}/fileindexConfigVersion.cmake
  COMPATIBILITY SameMinorVersion)
install(FILES
  ${PROJECT_SOURCE_DIR}/cmake/fileindexConfig.cmake
  ${PROJECT_BINARY_DIR}/fileindexConfigVersion.cmake
  DESTINATION ${fileindex_package})

file(RELATIVE_PATH FILEINDEX_PC_TO_PREFIX
  ${CMAKE_INSTALL_FULL_LIBDIR}/pkgconfig ${CMAKE_INSTALL_PREFIX})
configure_file(${PROJECT_SOURCE_DIR}/cmake/fileindex.pc.in ${PROJECT_BINARY_DIR}/fileindex.pc @ONLY)
install(FILES ${PROJECT_BINARY_DIR}/fileindex.pc DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig)

install(FILES ${PROJECT_SOURCE_DIR}/README.md ${PROJECT_SOURCE_DIR}/LICENSE
  DESTINATION ${CMAKE_INSTALL_DOCDIR})

if(fileindex_is_local)
  install(FILES ${PROJECT_SOURCE_DIR}/packaging/sysctl.d/30-fileindex.conf DESTINATION lib/sysctl.d)
  install(FILES ${PROJECT_SOURCE_DIR}/packaging/tmpfiles.d/fileindex.conf DESTINATION lib/tmpfiles.d)
endif()

if(TARGET fileindex_manual)
  include(cmake/manual.cmake)
endif()
