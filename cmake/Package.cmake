# cpack --preset release: the Debian packages, from a build with any prefix. Their files are in packaging/debian.
if(ZEL_SYSTEM_PLATFORM OR NOT ZEL_BUILD_PROGRAMS)
    return()
endif()

set(ZEL_PACKAGE_MAINTAINER "ZEL maintainers <maintainers@zel.invalid>" CACHE STRING
    "Who answers for the packages, as Debian writes it")
set(packages libzel libzel-dev zel-client zel-server)

set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME zel)
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "")  # each package has its own
set(CPACK_PACKAGE_CONTACT ${ZEL_PACKAGE_MAINTAINER})
set(CPACK_COMPONENTS_ALL ${packages})
set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_COMPONENTS_GROUPING ONE_PER_GROUP)
# Staged below DESTDIR, so that the install scripts see the prefix that the packages have.
set(CPACK_SET_DESTDIR ON)
set(CPACK_INSTALL_PREFIX /usr)
set(CPACK_STRIP_FILES ON)
set(CPACK_INSTALL_DEFAULT_DIRECTORY_PERMISSIONS
    OWNER_READ OWNER_WRITE OWNER_EXECUTE GROUP_READ GROUP_EXECUTE WORLD_READ WORLD_EXECUTE)

set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS_PRIVATE_DIRS ${CMAKE_LIBRARY_OUTPUT_DIRECTORY})
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)
# The packages of one build belong together. No other library is there when programs are unpacked, and none comes while
# other programs are there: whoever upgrades one package alone is refused before anything has changed.
set(CPACK_DEBIAN_LIBZEL_PACKAGE_BREAKS)
foreach(name libzel-dev zel-client zel-server)
    list(APPEND CPACK_DEBIAN_LIBZEL_PACKAGE_BREAKS "${name} (<< ${PROJECT_VERSION})" "${name} (>> ${PROJECT_VERSION})")
    string(TOUPPER ${name} key)
    set(CPACK_DEBIAN_${key}_PACKAGE_PREDEPENDS "libzel (= ${PROJECT_VERSION})")
endforeach()
list(JOIN CPACK_DEBIAN_LIBZEL_PACKAGE_BREAKS ", " CPACK_DEBIAN_LIBZEL_PACKAGE_BREAKS)

# debian_package(name section summary text): what dpkg tells of it, and the papers that each package carries.
set(papers ${CMAKE_BINARY_DIR}/packaging)
file(MAKE_DIRECTORY ${papers}/zel-server)
compress(packaging/debian/changelog ${papers}/changelog.gz)
function(debian_package name section summary text)
    string(TOUPPER ${name} key)
    set(CPACK_DEBIAN_${key}_PACKAGE_NAME ${name} PARENT_SCOPE)
    set(CPACK_DEBIAN_${key}_PACKAGE_SECTION ${section} PARENT_SCOPE)
    set(CPACK_COMPONENT_${key}_DISPLAY_NAME ${summary} PARENT_SCOPE)
    set(CPACK_DEBIAN_${key}_DESCRIPTION "${summary}\n${text}" PARENT_SCOPE)
    install(FILES packaging/debian/copyright ${papers}/changelog.gz
        DESTINATION ${CMAKE_INSTALL_DATADIR}/doc/${name} COMPONENT ${name} EXCLUDE_FROM_ALL)
    if(EXISTS ${PROJECT_SOURCE_DIR}/packaging/debian/${name}.lintian-overrides)
        install(FILES packaging/debian/${name}.lintian-overrides DESTINATION ${CMAKE_INSTALL_DATADIR}/lintian/overrides
            RENAME ${name} COMPONENT ${name} EXCLUDE_FROM_ALL)
    endif()
endfunction()

# The documentation, with its links from one text to another.
file(GLOB texts CONFIGURE_DEPENDS ${PROJECT_SOURCE_DIR}/docs/*.md)
foreach(name zel-client zel-server libzel-dev)
    install(FILES ${texts} DESTINATION ${CMAKE_INSTALL_DATADIR}/doc/${name} COMPONENT ${name} EXCLUDE_FROM_ALL)
endforeach()

# package_unit(name unit): the maintainer scripts of a package with this unit. What its purge removes beside is in
# packaging/debian/<name>.purge.
function(package_unit name unit)
    set(package ${name})
    string(TOUPPER ${name} key)
    file(READ packaging/debian/${name}.purge purge)
    set(scripts)
    foreach(script postinst prerm postrm)
        configure_file(packaging/debian/${script}.in ${papers}/${name}/${script} @ONLY
            FILE_PERMISSIONS OWNER_READ OWNER_WRITE OWNER_EXECUTE GROUP_READ GROUP_EXECUTE WORLD_READ WORLD_EXECUTE)
        list(APPEND scripts ${papers}/${name}/${script})
    endforeach()
    set(CPACK_DEBIAN_${key}_PACKAGE_CONTROL_EXTRA ${scripts} PARENT_SCOPE)
endfunction()

debian_package(libzel libs "Shared-folder synchronisation between two NAS: library"
"Keeps shared folders of one machine in step with copies at a paired server,
over rsync. This is the library of the client and the server, with the
libraries that tell it about its host.")
debian_package(libzel-dev libdevel "Shared-folder synchronisation between two NAS: headers"
"Keeps shared folders of one machine in step with copies at a paired server,
over rsync. Headers, CMake package and pkg-config file for programs that use
the library.")
debian_package(zel-client admin "Shared-folder synchronisation between two NAS: client"
"Pushes the shared folders that you choose to a paired server: on a schedule,
whenever something changes, or at once. zelctl keeps shares and tasks and
shows what goes on; zel_daemon runs the tasks.")
debian_package(zel-server admin "Shared-folder synchronisation between two NAS: server"
"Receives the shared folders that paired clients push, over TLS. zel_server
sets it up, keeps its accounts and shows its clients and shares; HAProxy
takes the connections, and rsync daemons of its own serve them.")

# What packages of programs with these libraries depend on.
file(WRITE ${papers}/libzel/shlibs "")
foreach(library IN LISTS libraries)
    file(APPEND ${papers}/libzel/shlibs "lib${library} ${PROJECT_VERSION_MAJOR} libzel (= ${PROJECT_VERSION})\n")
endforeach()
set(CPACK_DEBIAN_LIBZEL_PACKAGE_CONTROL_EXTRA
    ${papers}/libzel/shlibs ${PROJECT_SOURCE_DIR}/packaging/debian/triggers)
# Options of the rsync protocol that older ones lack carry the commands.
set(CPACK_DEBIAN_ZEL-CLIENT_PACKAGE_DEPENDS "rsync (>= 3.2.1)")
set(CPACK_DEBIAN_ZEL-CLIENT_PACKAGE_RECOMMENDS "openssh-client")
# Asks a server for its NetBIOS name; lists the shares of Samba.
set(CPACK_DEBIAN_ZEL-CLIENT_PACKAGE_SUGGESTS "samba-common-bin")
set(CPACK_DEBIAN_ZEL-SERVER_PACKAGE_DEPENDS "haproxy (>= 2.2), rsync (>= 3.2.1), passwd")
if(TARGET zel_daemon)
    package_unit(zel-client zel_daemon.service)
endif()
package_unit(zel-server zel_rsyncd.service)
install(FILES packaging/zel-client.tmpfiles DESTINATION lib/tmpfiles.d RENAME zel-client.conf
    COMPONENT zel-client EXCLUDE_FROM_ALL)
install(FILES packaging/debian/zel-server.logrotate DESTINATION /etc/logrotate.d RENAME zel-server
    COMPONENT zel-server EXCLUDE_FROM_ALL)
file(WRITE ${papers}/zel-server/conffiles "/etc/logrotate.d/zel-server\n")
list(APPEND CPACK_DEBIAN_ZEL-SERVER_PACKAGE_CONTROL_EXTRA ${papers}/zel-server/conffiles)

set_property(DIRECTORY APPEND PROPERTY CMAKE_CONFIGURE_DEPENDS
    packaging/debian/zel-client.purge packaging/debian/zel-server.purge)
include(CPack)
