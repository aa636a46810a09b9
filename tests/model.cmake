# The log, the task records with their schedule, and the host's facts and services.
zel_test(log_test log_test.cpp LIBRARIES test_syslog LABELS threads)
zel_test(sync_obj_test sync_obj_test.cpp sync_obj_map_test.cpp schedule_test.cpp)
zel_test(zel_test zel_test.cpp LABELS threads)
