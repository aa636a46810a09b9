zel_test(base_test base_test.cpp LIBRARIES base)
