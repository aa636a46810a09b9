# A tree of folders is watched beside find, which only reads it.
add_executable(watcher_bench watcher_bench.cpp ${PROJECT_SOURCE_DIR}/tests/support/temp_root.cpp)
target_link_libraries(watcher_bench PRIVATE daemon_parts)
# One mark on the whole file system beside a watch for each folder.
add_executable(mark_bench mark_bench.cpp ${PROJECT_SOURCE_DIR}/tests/support/temp_root.cpp)
target_link_libraries(mark_bench PRIVATE daemon_parts)
# The whole daemon is timed beside the programs that it stands on, and what it sends beside bare rsync.
foreach(name IN ITEMS daemon_bench changes_bench)
    add_executable(${name} ${name}.cpp
        ${PROJECT_SOURCE_DIR}/tests/integration/daemon_process.cpp
        ${PROJECT_SOURCE_DIR}/tests/integration/servers.cpp ${PROJECT_SOURCE_DIR}/tests/support/temp_root.cpp)
    target_link_libraries(${name} PRIVATE zel_flags zel base Threads::Threads)
    target_compile_definitions(${name} PRIVATE
        ZEL_DAEMON="$<TARGET_FILE:zel_daemon>" ZEL_SERVER="$<TARGET_FILE:zel_server>" ZELCTL="$<TARGET_FILE:zelctl>")
    add_dependencies(${name} zel_daemon zel_server zelctl)
endforeach()
