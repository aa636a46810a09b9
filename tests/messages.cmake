# The value, the transport, its TLS mode, the encoding and the endpoints.
zel_test(pobject_test pobject_test.cpp)
# The name rule is not exported: the test brings its own copy.
zel_test(channel_test channel_test.cpp ${PROJECT_SOURCE_DIR}/ZEL/cert_name.cpp LIBRARIES base)
zel_test(stream_test stream_test.cpp LABELS threads)
zel_test(ipc_test ipc_test.cpp)
find_package(OpenSSL REQUIRED)
zel_test(tls_test integration/tls_test.cpp LIBRARIES OpenSSL::Crypto LABELS integration)
zel_test(wire_test integration/wire_test.cpp LABELS integration)
target_compile_definitions(wire_test PRIVATE TESTS_FOLDER="${CMAKE_CURRENT_SOURCE_DIR}")
if(TARGET example_listener)
    zel_test(examples_test integration/examples_test.cpp LABELS integration)
    target_compile_definitions(examples_test PRIVATE
        EXAMPLE_LISTENER="$<TARGET_FILE:example_listener>" EXAMPLE_SENDER="$<TARGET_FILE:example_sender>")
    add_dependencies(examples_test example_listener example_sender)
endif()
zel_test(messages_stress_test integration/messages_stress_test.cpp LABELS stress threads)
