# The package for a main head's program: the engine's library and headers, the files that find them, and the example.
include(CMakePackageConfigHelpers)
include(GNUInstallDirs)

set(package_folder ${CMAKE_INSTALL_LIBDIR}/cmake/harl-updater)
install(TARGETS engine EXPORT harl-updater ARCHIVE DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT development)
install(DIRECTORY common/src/ DESTINATION include/harl-updater COMPONENT development FILES_MATCHING PATTERN *.h)
install(EXPORT harl-updater NAMESPACE harl:: FILE harl-updater-targets.cmake
  DESTINATION ${package_folder} COMPONENT development)

file(WRITE ${PROJECT_BINARY_DIR}/harl-updater-config.cmake
  "include(CMakeFindDependencyMacro)\n"
  "find_dependency(Threads)\n"
  "include(\${CMAKE_CURRENT_LIST_DIR}/harl-updater-targets.cmake)\n")
write_basic_package_version_file(${PROJECT_BINARY_DIR}/harl-updater-config-version.cmake
  COMPATIBILITY SameMajorVersion)
install(FILES ${PROJECT_BINARY_DIR}/harl-updater-config.cmake ${PROJECT_BINARY_DIR}/harl-updater-config-version.cmake
  DESTINATION ${package_folder} COMPONENT development)

configure_file(cmake/harl-updater.pc.in harl-updater.pc @ONLY)
install(FILES ${PROJECT_BINARY_DIR}/harl-updater.pc
  DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig COMPONENT development)

install(DIRECTORY examples DESTINATION share/doc/harl-updater-dev COMPONENT development)
install(FILES docs/main-head.md DESTINATION share/doc/harl-updater-dev COMPONENT development)
