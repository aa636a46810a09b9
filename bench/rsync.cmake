# Whole programs are timed here, so it measures by itself. Build only this: --target rsync_bench
add_executable(rsync_bench rsync_bench.cpp
    ${PROJECT_SOURCE_DIR}/tests/integration/servers.cpp ${PROJECT_SOURCE_DIR}/tests/support/temp_root.cpp)
find_package(Threads REQUIRED)
target_link_libraries(rsync_bench PRIVATE zel_flags tarqrsync tarq_internal Threads::Threads)
