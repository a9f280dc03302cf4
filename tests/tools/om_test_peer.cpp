// A peer for tests that need a real process with given entitlements: connects to the Unix socket
// at argv[1], writes one byte, and stays until the other side closes.
//   om_test_peer SOCKET    exits 0 after the close, 1 on any failure, 2 on bad usage
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

int main(int argc, char** argv)
{
    if (argc != 2) {
        std::fprintf(stderr, "usage: om_test_peer SOCKET\n");
        return 2;
    }
    sockaddr_un address {};
    address.sun_family = AF_UNIX;
    if (std::strlen(argv[1]) >= sizeof address.sun_path) {
        std::fprintf(stderr, "om_test_peer: socket path too long\n");
        return 2;
    }
    std::strcpy(address.sun_path, argv[1]);

    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0 || ::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) < 0) {
        std::perror("om_test_peer: connect");
        return 1;
    }
    char byte = 'p';
    while (::write(fd, &byte, 1) < 0) {
        if (errno != EINTR) {
            std::perror("om_test_peer: write");
            return 1;
        }
    }
    for (;;) {
        ssize_t n = ::read(fd, &byte, 1);
        if (n == 0)
            return 0;
        if (n < 0 && errno != EINTR) {
            std::perror("om_test_peer: read");
            return 1;
        }
    }
}
