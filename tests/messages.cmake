# The value, the transport, its TLS mode, the encoding and the endpoints.
zel_test(pobject_test pobject_test.cpp)
# The name rule is not exported: the test brings its own copy.
zel_test(channel_test channel_test.cpp ${PROJECT_SOURCE_DIR}/ZEL/cert_name.cpp)
zel_test(stream_test stream_test.cpp)
zel_test(ipc_test ipc_test.cpp)
