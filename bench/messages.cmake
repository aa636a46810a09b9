add_executable(messages_bench messages_bench.cpp messages/allocations.cpp messages/blocks.cpp messages/calls.cpp messages/fields.cpp
    messages/log_lines.cpp messages/rounds.cpp messages/task_map.cpp)
find_package(OpenSSL REQUIRED)
find_package(Threads REQUIRED)
find_package(PkgConfig REQUIRED)
pkg_check_modules(SYSTEMD REQUIRED IMPORTED_TARGET libsystemd)
find_package(spdlog REQUIRED)
target_link_libraries(messages_bench PRIVATE zel_flags zel Threads::Threads OpenSSL::SSL OpenSSL::Crypto
    PkgConfig::SYSTEMD spdlog::spdlog_header_only)
