# The system brings the platform libraries and their headers. CMAKE_PREFIX_PATH says where, when they are in a prefix of
# their own.
find_path(ZEL_TARQ_INCLUDE_DIR tarq/core.h REQUIRED)
foreach(name core sdk share netsdk hacore systemd rsync_wrapper)
    if(NOT EXISTS ${ZEL_TARQ_INCLUDE_DIR}/tarq/${name}.h)
        message(FATAL_ERROR "the system's platform has no ${ZEL_TARQ_INCLUDE_DIR}/tarq/${name}.h")
    endif()
endforeach()

# Behind the system's headers stand the two that need no library, tarq/root_path.h and tarq/owners.h: a system may lack
# them.
add_library(tarq_headers INTERFACE IMPORTED)
target_include_directories(tarq_headers INTERFACE ${ZEL_TARQ_INCLUDE_DIR} ${PROJECT_SOURCE_DIR}/platform/include)

foreach(name tarqcore tarqsdk tarqshare tarqnetsdk tarqhacore tarqsystemd tarqrsync)
    find_library(ZEL_LIB_${name} ${name} REQUIRED)
    add_library(${name} SHARED IMPORTED)
    set_target_properties(${name} PROPERTIES IMPORTED_LOCATION ${ZEL_LIB_${name}})
    target_link_libraries(${name} INTERFACE tarq_headers)
endforeach()

# What must start at once takes the shared libraries: there are no others.
add_library(tarqcore_archive ALIAS tarqcore)
add_library(tarqshare_archive ALIAS tarqshare)
