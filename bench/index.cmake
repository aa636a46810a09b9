# What changed in a share is found beside find, which only prints what is there.
add_executable(index_bench index_bench.cpp ${PROJECT_SOURCE_DIR}/tests/support/temp_root.cpp)
target_link_libraries(index_bench PRIVATE daemon_parts)
