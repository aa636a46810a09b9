#include <gmock/gmock.h>
#include <signal.h>

#include <cstdlib>

int main(int argc, char** argv) {
    // A test that wants a root folder makes its own; one from outside would lead it to somebody's
    // files.
    unsetenv("TARQ_ROOT");
    setenv("LC_ALL", "C", 1);
    testing::InitGoogleMock(&argc, argv);
    return RUN_ALL_TESTS();
}
