# Flags that every target is compiled with, carried by the interface target zel_flags; without sanitizers, by zel_plain_flags.
add_library(zel_plain_flags INTERFACE)
target_compile_options(zel_plain_flags INTERFACE
    -Wall -Wextra -Wshadow -Wconversion -Wnon-virtual-dtor -Woverloaded-virtual -Wformat=2
    -Werror)
if(CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
    # i386 passes doubles of a struct differently since GCC 4.6; the note is about other people's code.
    target_compile_options(zel_plain_flags INTERFACE -Wno-psabi)
endif()
# Large files on 32-bit hosts; time_t and long stay as wide as the host has them.
target_compile_definitions(zel_plain_flags INTERFACE _FILE_OFFSET_BITS=64)

add_library(zel_flags INTERFACE)
target_link_libraries(zel_flags INTERFACE zel_plain_flags)
if(ZEL_SANITIZE)
    target_compile_options(zel_flags INTERFACE
        -fsanitize=${ZEL_SANITIZE} -fno-omit-frame-pointer -fno-sanitize-recover=all
        -fno-sanitize=vptr  # opens a pipe for each look: in a process without descriptors it finds ghosts
        $<$<CXX_COMPILER_ID:GNU>:-Wno-maybe-uninitialized>)  # sees ghosts in instrumented code
    target_link_options(zel_flags INTERFACE -fsanitize=${ZEL_SANITIZE})
else()
    target_link_options(zel_flags INTERFACE -Wl,--no-undefined -Wl,-z,relro,-z,now)
    # What runs as root and reads what others send: overflows end the program.
    target_compile_options(zel_flags INTERFACE -fstack-protector-strong)
    target_compile_definitions(zel_flags INTERFACE $<$<NOT:$<CONFIG:Debug>>:_FORTIFY_SOURCE=2>)
endif()

# No path of the machine that builds stands in what it built.
target_compile_options(zel_plain_flags INTERFACE -ffile-prefix-map=${PROJECT_SOURCE_DIR}=.)
