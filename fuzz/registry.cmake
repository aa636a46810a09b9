# Built from the parser's own sources: a file for each input would be most of the work.
set(core ${PROJECT_SOURCE_DIR}/platform/tarqcore)
fuzz_target(section_file_fuzz section_file_fuzz.cpp
    ${core}/section_image.cpp ${core}/section_edit.cpp ${core}/format_string.cpp ${core}/error.cpp
    LIBRARIES tarqcore base)
target_include_directories(section_file_fuzz PRIVATE ${PROJECT_SOURCE_DIR})
