# What `cmake --install` puts under the prefix: the libraries, their headers, and the two ways in which other projects find
# them, a CMake package and pkg-config files. Nothing installed contains the prefix, so the tree may be moved; for
# that the directories have to be relative to it.

include(CMakePackageConfigHelpers)

foreach(directory IN ITEMS CMAKE_INSTALL_INCLUDEDIR CMAKE_INSTALL_LIBDIR)
  if(IS_ABSOLUTE "${${directory}}")
    message(FATAL_ERROR "${directory} must be relative to the prefix: the installed package is relocatable "
      "(QEL_INSTALL=OFF installs nothing of it)")
  endif()
endforeach()

# Five components: what programs need to run (qel_runtime), what is needed to build them (qel_development), the program
# qel (qel_program, beside its target), its systemd units (qel_systemd), which name the prefix, and the documents with the
# licence (qel_documentation).
install(TARGETS qelcommon EXPORT qelTargets
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR}
    COMPONENT qel_runtime NAMELINK_COMPONENT qel_development
  ARCHIVE DESTINATION ${CMAKE_INSTALL_LIBDIR}
    COMPONENT qel_development)
install(TARGETS qelprotocol EXPORT qelProtocolTargets
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR}
    COMPONENT qel_runtime NAMELINK_COMPONENT qel_development
  ARCHIVE DESTINATION ${CMAKE_INSTALL_LIBDIR}
    COMPONENT qel_development)
install(FILES ${PROJECT_SOURCE_DIR}/LICENSE ${PROJECT_SOURCE_DIR}/README.md ${PROJECT_SOURCE_DIR}/CHANGELOG.md
  DESTINATION ${CMAKE_INSTALL_DOCDIR}
  COMPONENT qel_documentation)
install(DIRECTORY ${PROJECT_SOURCE_DIR}/docs
  DESTINATION ${CMAKE_INSTALL_DOCDIR}
  COMPONENT qel_documentation)
install(DIRECTORY
    ${PROJECT_SOURCE_DIR}/headers/include/qel
    ${PROJECT_BINARY_DIR}/headers/include/qel
  DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}
  COMPONENT qel_development
  FILES_MATCHING PATTERN "*.hpp")

set(qel_package_dir ${CMAKE_INSTALL_LIBDIR}/cmake/qel)
configure_package_config_file(
  ${PROJECT_SOURCE_DIR}/packaging/qelConfig.cmake.in ${PROJECT_BINARY_DIR}/packaging/qelConfig.cmake
  INSTALL_DESTINATION ${qel_package_dir})
write_basic_package_version_file(${PROJECT_BINARY_DIR}/packaging/qelConfigVersion.cmake
  COMPATIBILITY SameMajorVersion)
install(EXPORT qelTargets NAMESPACE qel:: DESTINATION ${qel_package_dir} COMPONENT qel_development)
install(EXPORT qelProtocolTargets NAMESPACE qel:: DESTINATION ${qel_package_dir} COMPONENT qel_development)
install(FILES
    ${PROJECT_BINARY_DIR}/packaging/qelConfig.cmake
    ${PROJECT_BINARY_DIR}/packaging/qelConfigVersion.cmake
  DESTINATION ${qel_package_dir}
  COMPONENT qel_development)

file(RELATIVE_PATH qel_pc_to_prefix /${CMAKE_INSTALL_LIBDIR}/pkgconfig /)
string(REGEX REPLACE "/$" "" qel_pc_to_prefix "${qel_pc_to_prefix}")
foreach(package IN ITEMS qel qelprotocol)
  configure_file(${PROJECT_SOURCE_DIR}/packaging/${package}.pc.in ${PROJECT_BINARY_DIR}/packaging/${package}.pc @ONLY)
endforeach()
install(FILES ${PROJECT_BINARY_DIR}/packaging/qel.pc ${PROJECT_BINARY_DIR}/packaging/qelprotocol.pc
  DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig
  COMPONENT qel_development)
