zel_test(tarqcore_test tarqcore_test.cpp LIBRARIES test_syslog tarqcore dl LABELS threads)
zel_test(is_syncedshare_test is_syncedshare_test.cpp LIBRARIES test_syslog dl)
zel_test(registry_crash_test registry_crash_test.cpp)
