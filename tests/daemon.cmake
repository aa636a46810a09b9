if(ZEL_BUILD_PROGRAMS)
    zel_test(change_set_test change_set_test.cpp LIBRARIES daemon_parts)
    zel_test(watcher_test watcher_test.cpp LIBRARIES daemon_parts)
endif()
