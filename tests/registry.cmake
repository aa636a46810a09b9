zel_test(tarqcore_test tarqcore_test.cpp LIBRARIES tarqcore dl)
