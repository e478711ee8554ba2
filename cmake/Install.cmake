include(CMakePackageConfigHelpers)

install(TARGETS zeparelayd zepasdk
  EXPORT zeparelaydTargets
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR}
  ARCHIVE DESTINATION ${CMAKE_INSTALL_LIBDIR}
  RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR}
  INCLUDES DESTINATION ${CMAKE_INSTALL_INCLUDEDIR})
install(DIRECTORY ${PROJECT_SOURCE_DIR}/include/zeparelayd DESTINATION ${CMAKE_INSTALL_INCLUDEDIR})
install(DIRECTORY ${PROJECT_SOURCE_DIR}/sdk/include/zepasdk DESTINATION ${CMAKE_INSTALL_INCLUDEDIR})

install(EXPORT zeparelaydTargets
  NAMESPACE zeparelayd::
  DESTINATION ${CMAKE_INSTALL_LIBDIR}/cmake/zeparelayd)
configure_package_config_file(${PROJECT_SOURCE_DIR}/cmake/zeparelaydConfig.cmake.in
  ${PROJECT_BINARY_DIR}/zeparelaydConfig.cmake
  INSTALL_DESTINATION ${CMAKE_INSTALL_LIBDIR}/cmake/zeparelayd)
write_basic_package_version_file(${PROJECT_BINARY_DIR}/zeparelaydConfigVersion.cmake
  COMPATIBILITY SameMajorVersion)
install(FILES ${PROJECT_BINARY_DIR}/zeparelaydConfig.cmake ${PROJECT_BINARY_DIR}/zeparelaydConfigVersion.cmake
  DESTINATION ${CMAKE_INSTALL_LIBDIR}/cmake/zeparelayd)

# Relocatable: the prefix is found from the .pc file's own place, so a staged install works too.
file(RELATIVE_PATH ZEPA_PC_TO_PREFIX "/prefix/${CMAKE_INSTALL_LIBDIR}/pkgconfig" "/prefix")
configure_file(${PROJECT_SOURCE_DIR}/cmake/zeparelayd.pc.in ${PROJECT_BINARY_DIR}/zeparelayd.pc @ONLY)
install(FILES ${PROJECT_BINARY_DIR}/zeparelayd.pc DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig)
