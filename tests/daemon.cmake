# The daemon's parts.
if(ZEL_BUILD_PROGRAMS)
    foreach(part IN ITEMS change_set store task_plan watcher)
        zel_test(${part}_test ${part}_test.cpp LIBRARIES daemon_parts)
    endforeach()
endif()
