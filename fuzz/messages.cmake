# build/fuzz/bin/stream_fuzz -max_total_time=60 fuzz/corpus/stream
fuzz_target(stream_fuzz stream_fuzz.cpp LIBRARIES zel)
fuzz_target(cert_name_fuzz cert_name_fuzz.cpp ${PROJECT_SOURCE_DIR}/ZEL/cert_name.cpp LIBRARIES base)
target_include_directories(cert_name_fuzz PRIVATE ${PROJECT_SOURCE_DIR})
