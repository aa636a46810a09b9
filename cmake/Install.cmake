# cmake --install: libraries, headers, the CMake package, pkg-config files and the programs with their units, manual
# pages and completions. The components are the packages of cmake/Package.cmake.
include(CMakePackageConfigHelpers)

set(exported zel)
if(NOT ZEL_SYSTEM_PLATFORM)
    list(APPEND exported tarq_headers tarqcore tarqsdk tarqshare tarqnetsdk tarqhacore tarqsystemd tarqrsync)
    install(DIRECTORY platform/include/tarq DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}
        COMPONENT libzel-dev FILES_MATCHING PATTERN "*.h")
endif()
install(TARGETS ${exported} EXPORT ZELTargets
    LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT libzel NAMELINK_COMPONENT libzel-dev)
if(TARGET tarqrsync_connect)
    install(TARGETS tarqrsync_connect tarqrsync_askpass
        RUNTIME DESTINATION ${CMAKE_INSTALL_LIBDIR}/tarqrsync COMPONENT libzel)
endif()
install(EXPORT ZELTargets NAMESPACE ZEL:: DESTINATION ${CMAKE_INSTALL_LIBDIR}/cmake/ZEL COMPONENT libzel-dev)
install(DIRECTORY ZEL DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}
    COMPONENT libzel-dev FILES_MATCHING PATTERN "*.h" PATTERN "internal" EXCLUDE)

configure_package_config_file(cmake/ZELConfig.cmake.in ${CMAKE_BINARY_DIR}/ZELConfig.cmake
    INSTALL_DESTINATION ${CMAKE_INSTALL_LIBDIR}/cmake/ZEL)
write_basic_package_version_file(${CMAKE_BINARY_DIR}/ZELConfigVersion.cmake COMPATIBILITY SameMajorVersion)
install(FILES ${CMAKE_BINARY_DIR}/ZELConfig.cmake ${CMAKE_BINARY_DIR}/ZELConfigVersion.cmake
    DESTINATION ${CMAKE_INSTALL_LIBDIR}/cmake/ZEL COMPONENT libzel-dev)

# Relative to where the file lies: a tree that is moved stays right.
file(RELATIVE_PATH ZEL_PC_TO_PREFIX "/${CMAKE_INSTALL_LIBDIR}/pkgconfig" "/")
configure_file(cmake/zel.pc.in ${CMAKE_BINARY_DIR}/zel.pc @ONLY)
install(FILES ${CMAKE_BINARY_DIR}/zel.pc DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig COMPONENT libzel-dev)

# compress(file to): as manual pages and changelogs are installed; the same bytes each time.
find_program(GZIP gzip REQUIRED)
function(compress file to)
    set_property(DIRECTORY APPEND PROPERTY CMAKE_CONFIGURE_DEPENDS ${file})
    get_filename_component(folder ${to} DIRECTORY)
    file(MAKE_DIRECTORY ${folder})
    execute_process(COMMAND ${GZIP} -9nc ${PROJECT_SOURCE_DIR}/${file} OUTPUT_FILE ${to} COMMAND_ERROR_IS_FATAL ANY)
endfunction()

# install_program(target component section [unit...]): with its manual page, completion and units.
function(install_program target component section)
    install(TARGETS ${target} RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR} COMPONENT ${component})
    compress(packaging/man/${target}.${section} ${CMAKE_BINARY_DIR}/packaging/${target}.${section}.gz)
    install(FILES ${CMAKE_BINARY_DIR}/packaging/${target}.${section}.gz
        DESTINATION ${CMAKE_INSTALL_MANDIR}/man${section} COMPONENT ${component})
    install(FILES packaging/completions/${target}
        DESTINATION ${CMAKE_INSTALL_DATADIR}/bash-completion/completions COMPONENT ${component})
    list(APPEND ZEL_INSTALLED_${component} ${target})
    set(ZEL_INSTALLED_${component} ${ZEL_INSTALLED_${component}} PARENT_SCOPE)
    foreach(unit IN LISTS ARGN)
        # The program's folder is known only now, when the prefix is.
        install(CODE "
            set(bindir \"\${CMAKE_INSTALL_PREFIX}/${CMAKE_INSTALL_BINDIR}\")
            configure_file(\"${PROJECT_SOURCE_DIR}/packaging/${unit}.in\" \"${CMAKE_BINARY_DIR}/${unit}\" @ONLY)"
            COMPONENT ${component})
        install(FILES ${CMAKE_BINARY_DIR}/${unit} DESTINATION lib/systemd/system COMPONENT ${component})
    endforeach()
endfunction()

if(ZEL_BUILD_PROGRAMS)
    # What the completions share belongs to what the programs share.
    install(FILES packaging/completions/common.bash DESTINATION ${CMAKE_INSTALL_DATADIR}/zel
        RENAME completion.bash COMPONENT libzel)
    install_program(zelctl zel-client 1)
    # Parts of programs, which load them from where their libraries are.
    install(TARGETS zelctl_commands LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT zel-client)
    install(TARGETS zel_server_commands zel_versions_guard LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT zel-server)
    if(TARGET zel_daemon)
        install_program(zel_daemon zel-client 8 zel_daemon.service)
    endif()
    install_program(zel_server zel-server 8 zel_rsyncd.service zel_front.service)
endif()

# The loader finds what lies under /usr by itself; elsewhere libraries and programs find each other by their own path.
function(remove_rpath_under_usr component folder)
    foreach(target IN LISTS ARGN)
        install(CODE "
            if(CMAKE_INSTALL_PREFIX STREQUAL \"/usr\")
                file(RPATH_REMOVE FILE \"\$ENV{DESTDIR}/usr/${folder}/$<TARGET_FILE_NAME:${target}>\")
            endif()" COMPONENT ${component})
    endforeach()
endfunction()
set(libraries ${exported})
list(REMOVE_ITEM libraries tarq_headers)
remove_rpath_under_usr(libzel ${CMAKE_INSTALL_LIBDIR} ${libraries})
if(ZEL_BUILD_PROGRAMS)
    remove_rpath_under_usr(zel-client ${CMAKE_INSTALL_LIBDIR} zelctl_commands)
    remove_rpath_under_usr(zel-server ${CMAKE_INSTALL_LIBDIR} zel_server_commands)
endif()
foreach(component zel-client zel-server)
    remove_rpath_under_usr(${component} ${CMAKE_INSTALL_BINDIR} ${ZEL_INSTALLED_${component}})
endforeach()
