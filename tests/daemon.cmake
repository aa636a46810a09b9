# The daemon's parts.
if(TARGET daemon_parts)
    zel_test(store_test store_test.cpp LIBRARIES daemon_parts)
    zel_test(task_plan_test task_plan_test.cpp LIBRARIES daemon_parts)
endif()
