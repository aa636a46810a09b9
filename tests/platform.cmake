# The internals are linked in beside the library, so that a test can bring its own /sys and mount table.
if(TARGET tarq_internal)
    set(platform ${PROJECT_SOURCE_DIR}/platform)
    find_package(PkgConfig REQUIRED)
    pkg_check_modules(SYSTEMD REQUIRED IMPORTED_TARGET libsystemd)
    zel_test(tarqhost_test tarqhost_test.cpp
        ${platform}/tarqsdk/identity.cpp ${platform}/tarqnetsdk/interfaces.cpp
        LIBRARIES tarq_internal)
    zel_test(tarqshare_test tarqshare_test.cpp
        ${platform}/tarqshare/mount_table.cpp ${platform}/tarqshare/volume.cpp
        LIBRARIES tarq_internal)
    zel_test(tarqsystemd_test tarqsystemd_test.cpp
        ${platform}/tarqsystemd/bus_units.cpp ${platform}/tarqsystemd/manager_bus.cpp
        LIBRARIES tarq_internal PkgConfig::SYSTEMD)
endif()
