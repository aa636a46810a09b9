zel_test(rsyncer_test rsyncer_test.cpp)
if(ZEL_BUILD_PROGRAMS)
    zel_test(zel_server_test zel_server_test.cpp LIBRARIES server_parts)
endif()
