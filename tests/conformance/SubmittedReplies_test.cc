#include <algorithm>
#include <ostream>
#include <string>
#include <vector>

#include "service/ServicerTest.h"

namespace storix {
namespace {

struct SubmittedReplyCase {
  const char *label;
  std::string_view request;
  Arguments arguments;
  Dictionary entitlements;

  friend void PrintTo(const SubmittedReplyCase &replyCase, std::ostream *out) { *out << replyCase.label; }
};

// What a request answers by itself goes to the global queue after the line about it is in the log, so
// that a client that has its answer finds the reason there.
class SubmittedRepliesTest : public ServicerTest, public ::testing::WithParamInterface<SubmittedReplyCase> {};

const Dictionary reads{{"com.tessel.storix.acl-read", true}};
const Dictionary writes{{"com.tessel.storix.acl-write", true}};

INSTANTIATE_TEST_SUITE_P(
    Requests, SubmittedRepliesTest,
    ::testing::Values(SubmittedReplyCase{"wakeUp", SXDaemon::wakeUpName, {}, {}},
                      SubmittedReplyCase{"providersRefused", SXDaemon::providersName, {}, {}},
                      SubmittedReplyCase{"extendSandboxRefused", SXDaemon::extendSandboxName, Arguments(3), {}},
                      SubmittedReplyCase{"extendSandbox", SXDaemon::extendSandboxName, Arguments(3), writes},
                      SubmittedReplyCase{"placeholderRefused", SXDaemon::providePlaceholderName, Arguments(3), {}},
                      SubmittedReplyCase{"placeholder", SXDaemon::providePlaceholderName, Arguments(3), reads},
                      SubmittedReplyCase{"start", SXDaemon::startProvidingName, Arguments(3), reads},
                      SubmittedReplyCase{"stop", SXDaemon::stopProvidingName, Arguments(3), reads},
                      SubmittedReplyCase{"extendBookmark", SXDaemon::extendBookmarkName, Arguments(2), {}},
                      SubmittedReplyCase{"bookmarkableString", SXDaemon::bookmarkableStringName, Arguments(1), {}},
                      SubmittedReplyCase{"documentURL", SXDaemon::documentURLName, Arguments(1), {}}),
    [](const ::testing::TestParamInfo<SubmittedReplyCase> &request) { return std::string(request.param.label); });

TEST_P(SubmittedRepliesTest, TheLineStandsInTheLogBeforeTheReplyIsSubmitted) {
  connect(GetParam().entitlements);
  platform().executor().setSubmissionObserver([this] { platform().trace().add("submitted"); });
  call(GetParam().request, GetParam().arguments);
  platform().executor().setSubmissionObserver({});
  const std::vector<std::string> lines = trace();
  const auto isLine = [](const std::string &line) { return line.starts_with("log "); };
  const auto lastLine = std::find_if(lines.rbegin(), lines.rend(), isLine);
  const auto lastSubmitted = std::find(lines.rbegin(), lines.rend(), "submitted");
  ASSERT_NE(lastLine, lines.rend());
  EXPECT_LT(lastSubmitted, lastLine) << ::testing::PrintToString(lines);
  EXPECT_TRUE(lines.back().starts_with("reply peer 100 ")) << lines.back();
}

}  // namespace
}  // namespace storix
