# A tree of folders is watched beside find, which only reads it.
add_executable(watcher_bench watcher_bench.cpp ${PROJECT_SOURCE_DIR}/tests/support/temp_root.cpp)
target_link_libraries(watcher_bench PRIVATE daemon_parts)
# The whole daemon is timed beside the programs that it stands on.
add_executable(daemon_bench daemon_bench.cpp
    ${PROJECT_SOURCE_DIR}/tests/integration/daemon_process.cpp
    ${PROJECT_SOURCE_DIR}/tests/integration/servers.cpp ${PROJECT_SOURCE_DIR}/tests/support/temp_root.cpp)
target_link_libraries(daemon_bench PRIVATE zel_flags zel base Threads::Threads)
target_compile_definitions(daemon_bench PRIVATE
    ZEL_DAEMON="$<TARGET_FILE:zel_daemon>" ZEL_SERVER="$<TARGET_FILE:zel_server>" ZELCTL="$<TARGET_FILE:zelctl>")
add_dependencies(daemon_bench zel_daemon zel_server zelctl)
