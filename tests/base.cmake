zel_test(open_beneath_test open_beneath_test.cpp LIBRARIES base)
