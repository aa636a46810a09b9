# The next run of a schedule beside the bare calendar calls that it needs.
add_executable(schedule_bench schedule_bench.cpp)
target_link_libraries(schedule_bench PRIVATE zel_flags zel ${CMAKE_DL_LIBS})
