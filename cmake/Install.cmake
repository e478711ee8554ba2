include(CMakePackageConfigHelpers)

# Components (one Debian package each, cmake/Package.cmake): runtime, sdk, dev.
install(TARGETS zeparelayd
  EXPORT zeparelaydTargets
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT runtime NAMELINK_COMPONENT dev
  INCLUDES DESTINATION ${CMAKE_INSTALL_INCLUDEDIR})
install(TARGETS zepasdk
  EXPORT zeparelaydTargets
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT sdk NAMELINK_COMPONENT dev
  INCLUDES DESTINATION ${CMAKE_INSTALL_INCLUDEDIR})
install(DIRECTORY ${PROJECT_SOURCE_DIR}/include/zeparelayd DESTINATION ${CMAKE_INSTALL_INCLUDEDIR} COMPONENT dev)
install(DIRECTORY ${PROJECT_SOURCE_DIR}/sdk/include/zepasdk DESTINATION ${CMAKE_INSTALL_INCLUDEDIR} COMPONENT dev)

install(EXPORT zeparelaydTargets
  NAMESPACE zeparelayd::
  DESTINATION ${CMAKE_INSTALL_LIBDIR}/cmake/zeparelayd
  COMPONENT dev)
configure_package_config_file(${PROJECT_SOURCE_DIR}/cmake/zeparelaydConfig.cmake.in
  ${PROJECT_BINARY_DIR}/zeparelaydConfig.cmake
  INSTALL_DESTINATION ${CMAKE_INSTALL_LIBDIR}/cmake/zeparelayd)
write_basic_package_version_file(${PROJECT_BINARY_DIR}/zeparelaydConfigVersion.cmake
  COMPATIBILITY SameMajorVersion)
install(FILES ${PROJECT_BINARY_DIR}/zeparelaydConfig.cmake ${PROJECT_BINARY_DIR}/zeparelaydConfigVersion.cmake
  DESTINATION ${CMAKE_INSTALL_LIBDIR}/cmake/zeparelayd COMPONENT dev)

# Relocatable: the prefix is found from the .pc file's own place, so a staged install works too.
file(RELATIVE_PATH ZEPA_PC_TO_PREFIX "/prefix/${CMAKE_INSTALL_LIBDIR}/pkgconfig" "/prefix")
# The SDK has its own .pc: programs that set the system root link it directly.
configure_file(${PROJECT_SOURCE_DIR}/cmake/zeparelayd.pc.in ${PROJECT_BINARY_DIR}/zeparelayd.pc @ONLY)
configure_file(${PROJECT_SOURCE_DIR}/cmake/zepasdk.pc.in ${PROJECT_BINARY_DIR}/zepasdk.pc @ONLY)
install(FILES ${PROJECT_BINARY_DIR}/zeparelayd.pc ${PROJECT_BINARY_DIR}/zepasdk.pc
  DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig COMPONENT dev)
