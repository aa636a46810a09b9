zel_test(rsyncer_test rsyncer_test.cpp)
if(ZEL_BUILD_PROGRAMS)
    zel_test(bandwidth_test bandwidth_test.cpp LIBRARIES program_common)
    zel_test(zel_server_test zel_server_test.cpp LIBRARIES server_parts)

    # A whole client and a whole server.
    add_library(test_whole STATIC integration/client_and_server.cpp)
    target_link_libraries(test_whole PUBLIC test_servers)
    target_compile_definitions(test_whole PUBLIC
        ZELCTL="$<TARGET_FILE:zelctl>" ZEL_SERVER="$<TARGET_FILE:zel_server>"
        ZEL_VERSIONS_GUARD="$<TARGET_FILE:zel_versions_guard>")
    add_dependencies(test_whole zelctl zel_server)
    zel_test(push_test integration/push_test.cpp
        LIBRARIES test_whole TIMEOUT 300 SHARDS 3 LABELS integration)
    zel_test(changes_test integration/changes_test.cpp
        LIBRARIES test_whole client_common TIMEOUT 300 LABELS integration)
    zel_test(restore_test integration/restore_test.cpp
        LIBRARIES test_daemon test_whole zelctl_parts TIMEOUT 300 LABELS integration)
    zel_test(front_test integration/front_test.cpp
        LIBRARIES test_whole server_parts LABELS integration)
    add_test(NAME completion_test
        COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/integration/completion_test.sh ${PROJECT_SOURCE_DIR}
            $<TARGET_FILE:zelctl>)
endif()
