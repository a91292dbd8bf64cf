#include "platform/process_launcher.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <chrono>
#include <csignal>
#include <string>

#include "platform/testing/log_capture.h"

namespace tarvod {
namespace {

using ::testing::HasSubstr;

// The input-pipe outcomes against real programs: one that reads everything, one that closes
// its input at once, one that never reads, one that cannot be executed. SIGPIPE keeps its
// default action here, as it has in a caller that does not ignore it.
TEST(ProcessLauncher, FillsAnInputPipeWithoutBlockingPastItsLimit) {
  testing::LogCapture capture(0);
  const std::string output = capture.directory() + "/out";
  const std::string big(1 << 20, 'x');
  const struct Case {
    std::vector<std::string> arguments;
    std::string input;
    int error;  // of the input's status
    ExitStatus status;
  } cases[] = {
      {{"/bin/sh", "-c", "cat > " + output}, big, 0, 0},
      {{"/bin/true"}, big, EPIPE, 0},
      {{"/bin/sleep", "30"}, big, ETIMEDOUT, 128 + SIGTERM},
      {{"/nonexistent/mail"}, "x", EPIPE, ENOENT},
  };
  for (const Case& c : cases) {
    LaunchRequest request;
    request.program = c.arguments[0];
    request.arguments = c.arguments;
    request.input = c.input;
    request.inputSeconds = 0.3;
    request.execFailure = ChildMessage{"can't execute " + request.program + " errno = ", true};
    const auto started = std::chrono::steady_clock::now();
    Result<ChildProcess> child = ProcessLauncher::Real().launch(request);
    ASSERT_TRUE(child.ok());
    EXPECT_LT(std::chrono::steady_clock::now() - started, std::chrono::seconds(5));
    EXPECT_EQ(child.value().input.error(), c.error) << request.program;
    std::optional<ExitStatus> status = ProcessLauncher::Real().wait(child.value(), 0.5);
    if (!status) status = ProcessLauncher::Real().terminate(child.value(), 0.1);
    EXPECT_EQ(*status, c.status) << request.program;
  }
  EXPECT_EQ(testing::ReadWholeFile(output), big);
  EXPECT_THAT(capture.text(), HasSubstr("can't execute /nonexistent/mail errno = 2\n"));
}

}  // namespace
}  // namespace tarvod
