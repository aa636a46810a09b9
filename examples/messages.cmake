foreach(name listener sender)
    add_executable(example_${name} ${name}.cpp)
    target_link_libraries(example_${name} PRIVATE zel_flags ZEL::zel)
endforeach()
