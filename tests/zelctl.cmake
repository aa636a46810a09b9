# The command line, against a daemon that the test plays itself.
if(ZEL_BUILD_PROGRAMS)
    zel_test(zelctl_test zelctl_test.cpp LIBRARIES zelctl_parts test_whole)
    target_compile_definitions(zelctl_test PRIVATE SOURCE_FOLDER="${PROJECT_SOURCE_DIR}")
endif()
