# cmake --install: libraries, headers, the CMake package, pkg-config files and the programs.
include(CMakePackageConfigHelpers)

set(exported zel)
if(NOT ZEL_SYSTEM_PLATFORM)
    list(APPEND exported tarq_headers tarqcore tarqsdk tarqshare tarqnetsdk tarqhacore tarqsystemd tarqrsync)
    install(DIRECTORY platform/include/tarq DESTINATION ${CMAKE_INSTALL_INCLUDEDIR} FILES_MATCHING PATTERN "*.h")
endif()
install(TARGETS ${exported} EXPORT ZELTargets
    LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR})
install(EXPORT ZELTargets NAMESPACE ZEL:: DESTINATION ${CMAKE_INSTALL_LIBDIR}/cmake/ZEL)
install(DIRECTORY ZEL DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}
    FILES_MATCHING PATTERN "*.h" PATTERN "internal" EXCLUDE)

configure_package_config_file(cmake/ZELConfig.cmake.in ${CMAKE_BINARY_DIR}/ZELConfig.cmake
    INSTALL_DESTINATION ${CMAKE_INSTALL_LIBDIR}/cmake/ZEL)
write_basic_package_version_file(${CMAKE_BINARY_DIR}/ZELConfigVersion.cmake COMPATIBILITY SameMajorVersion)
install(FILES ${CMAKE_BINARY_DIR}/ZELConfig.cmake ${CMAKE_BINARY_DIR}/ZELConfigVersion.cmake
    DESTINATION ${CMAKE_INSTALL_LIBDIR}/cmake/ZEL)

# Relative to where the file lies: a tree that is moved stays right.
file(RELATIVE_PATH ZEL_PC_TO_PREFIX "/${CMAKE_INSTALL_LIBDIR}/pkgconfig" "/")
configure_file(cmake/zel.pc.in ${CMAKE_BINARY_DIR}/zel.pc @ONLY)
install(FILES ${CMAKE_BINARY_DIR}/zel.pc DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig)

if(ZEL_BUILD_PROGRAMS)
    install(TARGETS zelctl zel_server RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR})
    install(TARGETS zelctl_commands LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR})
    install(FILES packaging/zel_rsyncd.service DESTINATION lib/systemd/system)
endif()
