add_executable(messages_bench messages_bench.cpp)
find_package(Threads REQUIRED)
target_link_libraries(messages_bench PRIVATE zel_flags zel Threads::Threads)
