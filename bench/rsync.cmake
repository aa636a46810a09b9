# Whole programs are timed here, so it measures by itself.
find_package(Threads REQUIRED)
add_executable(rsync_bench rsync_bench.cpp
    ${PROJECT_SOURCE_DIR}/tests/integration/servers.cpp ${PROJECT_SOURCE_DIR}/tests/support/temp_root.cpp)
target_link_libraries(rsync_bench PRIVATE zel_flags tarqrsync base Threads::Threads)
target_compile_definitions(rsync_bench PRIVATE ZEL_SERVER="$<TARGET_FILE:zel_server>"
    ZELCTL="$<TARGET_FILE:zelctl>")
add_dependencies(rsync_bench zel_server zelctl)
