zel_test(rsyncer_test rsyncer_test.cpp)
if(ZEL_BUILD_PROGRAMS)
    zel_test(zel_server_test zel_server_test.cpp LIBRARIES server_parts)
    zel_test(push_test integration/push_test.cpp
        LIBRARIES test_servers TIMEOUT 300 LABELS integration)
    target_compile_definitions(push_test PRIVATE
        ZELCTL="$<TARGET_FILE:zelctl>" ZEL_SERVER="$<TARGET_FILE:zel_server>")
    add_dependencies(push_test zelctl zel_server)
    add_test(NAME completion_test
        COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/integration/completion_test.sh ${PROJECT_SOURCE_DIR})
endif()
