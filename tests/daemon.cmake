# The daemon's parts, and the daemon as a whole.
if(ZEL_BUILD_PROGRAMS)
    foreach(part IN ITEMS change_set file_index store task_machine verify_slice watcher)
        zel_test(${part}_test ${part}_test.cpp LIBRARIES daemon_parts)
    endforeach()

    add_library(test_daemon STATIC integration/daemon_process.cpp)
    target_link_libraries(test_daemon PUBLIC test_support)
    target_compile_definitions(test_daemon PUBLIC ZEL_DAEMON="$<TARGET_FILE:zel_daemon>")
    add_dependencies(test_daemon zel_daemon)
    # The service puts its own rsync runs in front of the real ones.
    zel_test(service_test service_test.cpp LIBRARIES test_whole daemon_parts LABELS threads)
    # ZEL_STRESS_SECONDS says how large the bursts of changes are.
    zel_test(daemon_test integration/daemon_test.cpp
        LIBRARIES test_daemon test_whole daemon_parts TIMEOUT 600 SHARDS 3 LABELS integration)
    zel_test(recover_test integration/recover_test.cpp
        LIBRARIES test_daemon test_whole TIMEOUT 300 LABELS integration)
    zel_test(brake_test integration/brake_test.cpp
        LIBRARIES test_daemon test_whole TIMEOUT 300 LABELS integration)
endif()
