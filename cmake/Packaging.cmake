# Installing, and the packages made of what is installed: the libraries, what building with them takes, and the tools.
include(GNUInstallDirs)
include(CMakePackageConfigHelpers)
set(CMAKE_SKIP_INSTALL_ALL_DEPENDENCY ON)  # tests and examples need not be built for it

foreach(target cellar cellar_host cellar_testing)
  set_target_properties(${target} PROPERTIES INSTALL_RPATH $ORIGIN)
endforeach()
set_target_properties(cellar_host PROPERTIES EXPORT_NAME host)
set_target_properties(cellar_testing PROPERTIES EXPORT_NAME testing)
install(TARGETS cellar cellar_host cellar_testing EXPORT cellar-targets
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT libraries NAMELINK_COMPONENT development
  ARCHIVE DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT development)

list(TRANSFORM CELLAR_PUBLIC_HEADERS PREPEND src/ OUTPUT_VARIABLE public_headers)
install(FILES ${public_headers} DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}/cellar COMPONENT development)
install(DIRECTORY src/executor src/session host DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}/cellar COMPONENT development
  FILES_MATCHING PATTERN "*.h" PATTERN "configuration" EXCLUDE PATTERN "errors" EXCLUDE PATTERN "figures" EXCLUDE
  PATTERN "limits" EXCLUDE PATTERN "memory" EXCLUDE PATTERN "queues" EXCLUDE PATTERN "sessions" EXCLUDE
  PATTERN "conformance" EXCLUDE PATTERN "powercut" EXCLUDE)

set(package_directory ${CMAKE_INSTALL_LIBDIR}/cmake/cellar)
configure_package_config_file(cmake/cellar-config.cmake.in cellar-config.cmake INSTALL_DESTINATION ${package_directory})
write_basic_package_version_file(cellar-config-version.cmake COMPATIBILITY SameMinorVersion)
install(FILES ${PROJECT_BINARY_DIR}/cellar-config.cmake ${PROJECT_BINARY_DIR}/cellar-config-version.cmake
  DESTINATION ${package_directory} COMPONENT development)
install(EXPORT cellar-targets NAMESPACE cellar:: DESTINATION ${package_directory} COMPONENT development)

# From the folder of the .pc files up to the prefix, so that an installed tree can be moved.
file(RELATIVE_PATH prefix_from_pc /prefix/${CMAKE_INSTALL_LIBDIR}/pkgconfig /prefix)
foreach(name cellar cellar-host)
  configure_file(cmake/${name}.pc.in ${name}.pc @ONLY)
  install(FILES ${PROJECT_BINARY_DIR}/${name}.pc DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig COMPONENT development)
endforeach()

if(CELLAR_BUILD_TOOLS)
  file(RELATIVE_PATH libraries_from_tools /prefix/${CMAKE_INSTALL_BINDIR} /prefix/${CMAKE_INSTALL_LIBDIR})
  set_target_properties(cellar_tool PROPERTIES INSTALL_RPATH $ORIGIN/${libraries_from_tools})
  install(TARGETS cellar_tool RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR} COMPONENT tools)
  install(FILES docs/cellar.1 DESTINATION ${CMAKE_INSTALL_MANDIR}/man1 COMPONENT tools)
  install(FILES packaging/cellar.bash DESTINATION ${CMAKE_INSTALL_DATADIR}/bash-completion/completions RENAME cellar
    COMPONENT tools)
endif()

set(CPACK_PACKAGE_VENDOR "The authors of Cellar")
set(CPACK_PACKAGE_CONTACT "The authors of Cellar <cellar@localhost>")
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_STRIP_FILES ON)
set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS_PRIVATE_DIRS ${PROJECT_BINARY_DIR})
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS ON)
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS_POLICY =)
set(CPACK_DEBIAN_ENABLE_COMPONENT_DEPENDS ON)
set(library_package libcellar${PROJECT_VERSION_MAJOR}.${PROJECT_VERSION_MINOR})
set(CPACK_DEBIAN_LIBRARIES_PACKAGE_NAME ${library_package})
set(CPACK_DEBIAN_LIBRARIES_PACKAGE_SECTION libs)
set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_NAME libcellar-dev)
set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_SECTION libdevel)
set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_SHLIBDEPS OFF)
set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_DEPENDS "nlohmann-json3-dev")
set(CPACK_DEBIAN_TOOLS_PACKAGE_NAME cellar-tools)
set(CPACK_DEBIAN_TOOLS_PACKAGE_SECTION utils)
set(CPACK_COMPONENT_LIBRARIES_DESCRIPTION "On-device storage for applications: the libraries")
set(CPACK_COMPONENT_DEVELOPMENT_DESCRIPTION "On-device storage for applications: headers, and how to find the libraries")
set(CPACK_COMPONENT_DEVELOPMENT_DEPENDS libraries)
set(CPACK_COMPONENT_TOOLS_DESCRIPTION "On-device storage for applications: the cellar program")
set(CPACK_COMPONENT_TOOLS_DEPENDS libraries)
set(CPACK_GENERATOR DEB)
include(CPack)
