# The system brings the platform libraries and their headers: link them by name.
set(ZEL_PLATFORM_LIBRARIES tarqcore tarqsdk tarqshare tarqnetsdk tarqhacore tarqsystemd tarqrsync)
foreach(name IN LISTS ZEL_PLATFORM_LIBRARIES)
    find_library(ZEL_LIB_${name} ${name} REQUIRED)
    add_library(${name} SHARED IMPORTED)
    set_target_properties(${name} PROPERTIES IMPORTED_LOCATION ${ZEL_LIB_${name}})
    # Only the root folder rule is the project's own on such a host.
    target_include_directories(${name} INTERFACE ${PROJECT_SOURCE_DIR}/platform/include)
endforeach()
