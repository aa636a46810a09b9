zel_test(tarqcore_test tarqcore_test.cpp LIBRARIES tarqcore dl LABELS threads)
zel_test(is_syncedshare_test is_syncedshare_test.cpp LIBRARIES test_syslog dl)
zel_test(registry_crash_test registry_crash_test.cpp)
# ZEL_STRESS_SECONDS says how long; a minute is what a release is tested with.
zel_test(registry_stress_test registry_stress_test.cpp LABELS stress TIMEOUT 600)
