#include "Platform/Processes.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>

namespace Korvel::Platform {
namespace {

// In a process of its own, since a hard limit cannot be raised again.
TEST(InitProcess, RaisesTheLimitOfFilesAsFarAsItMay) {
    for (rlim_t hard : {1024, 10001}) {
        auto body = [&] {
            rlimit files = {256, hard};
            if (setrlimit(RLIMIT_NOFILE, &files) != 0) _exit(7);  // we may have fewer ourselves
            umask(022);
            InitProcess();
            getrlimit(RLIMIT_NOFILE, &files);
            raise(SIGPIPE);
            _exit(files.rlim_cur == std::min<rlim_t>(hard, 10000) && umask(0) == 0 ? 7 : 1);
        };
        EXPECT_EXIT(body(), testing::ExitedWithCode(7), "") << hard;
    }
}

}  // namespace
}  // namespace Korvel::Platform
