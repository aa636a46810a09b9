add_library(test_servers STATIC integration/servers.cpp)
target_link_libraries(test_servers PUBLIC test_support base)

if(TARGET tarqrsync_parts)
    zel_test(tarqrsync_test tarqrsync_test.cpp LIBRARIES tarqrsync_parts)
endif()
zel_test(rsync_wrapper_test integration/rsync_wrapper_test.cpp
    LIBRARIES test_syslog test_servers tarqrsync TIMEOUT 300 LABELS integration)
target_compile_definitions(rsync_wrapper_test PRIVATE
    CONNECT="$<TARGET_FILE_DIR:tarqrsync>/tarqrsync/connect")
