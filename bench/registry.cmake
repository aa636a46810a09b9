# GLib's key files stand beside the registry; only the benchmark knows GLib.
find_package(PkgConfig REQUIRED)
pkg_check_modules(GLIB REQUIRED IMPORTED_TARGET glib-2.0)
add_executable(registry_bench registry_bench.cpp)
target_link_libraries(registry_bench PRIVATE zel_flags zel PkgConfig::GLIB)
