# A tree of folders is watched beside find, which only reads it.
add_executable(watcher_bench watcher_bench.cpp ${PROJECT_SOURCE_DIR}/tests/support/temp_root.cpp)
target_link_libraries(watcher_bench PRIVATE daemon_parts tarq_internal)
