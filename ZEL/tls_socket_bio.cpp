#include "ZEL/internal/tls_socket_bio.h"

#include <errno.h>
#include <sys/socket.h>

#include <memory>
#include <new>

namespace ZEL {

namespace {

struct Data {
    int fd;
    Patience patience;
};

Data& DataOf(BIO* bio) {
    return *static_cast<Data*>(BIO_get_data(bio));
}

int SocketOf(BIO* bio) {
    return DataOf(bio).fd;
}

int Destroy(BIO* bio) {
    delete static_cast<Data*>(BIO_get_data(bio));
    return 1;
}

int Write(BIO* bio, const char* data, int length) {
    BIO_clear_retry_flags(bio);
    const ssize_t count =
        send(SocketOf(bio), data, static_cast<size_t>(length), MSG_NOSIGNAL | MSG_DONTWAIT);
    if (count < 0 && BIO_sock_non_fatal_error(errno)) {
        BIO_set_retry_write(bio);
    }
    return static_cast<int>(count);
}

int Read(BIO* bio, char* buffer, int length) {
    BIO_clear_retry_flags(bio);
    const ssize_t count = recv(SocketOf(bio), buffer, static_cast<size_t>(length), MSG_DONTWAIT);
    if (count < 0 && BIO_sock_non_fatal_error(errno)) {
        BIO_set_retry_read(bio);
    }
    return static_cast<int>(count);
}

long Control(BIO* bio, int command, long, void* argument) {
    switch (command) {
        case BIO_C_GET_FD:
            if (argument != nullptr) {
                *static_cast<int*>(argument) = SocketOf(bio);
            }
            return SocketOf(bio);
        case BIO_CTRL_FLUSH:
            return 1;  // nothing is held back
        default:
            return 0;
    }
}

const BIO_METHOD* MakeMethod() {
    // BIO_TYPE_DESCRIPTOR lets SSL_get_fd() find the socket.
    BIO_METHOD* method = BIO_meth_new(
        BIO_get_new_index() | BIO_TYPE_SOURCE_SINK | BIO_TYPE_DESCRIPTOR, "channel socket");
    if (method != nullptr) {
        BIO_meth_set_write(method, Write);
        BIO_meth_set_read(method, Read);
        BIO_meth_set_ctrl(method, Control);
        BIO_meth_set_destroy(method, Destroy);
    }
    return method;
}

}  // namespace

BIO* NewTlsSocketBio(int fd) {
    static const BIO_METHOD* const method = MakeMethod();
    if (fd < 0 || method == nullptr) {
        return nullptr;
    }
    std::unique_ptr<Data> data(new (std::nothrow) Data{fd, {}});
    BIO* bio = data == nullptr ? nullptr : BIO_new(method);
    if (bio != nullptr) {
        BIO_set_data(bio, data.release());
        BIO_set_init(bio, 1);
    }
    return bio;
}

Patience& PatienceOf(BIO* bio) {
    return DataOf(bio).patience;
}

}  // namespace ZEL
