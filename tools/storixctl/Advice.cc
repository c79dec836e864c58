#include "tools/storixctl/Advice.h"

#include <utility>

#include "storix/ClientOptions.h"

namespace storix::ctl {

namespace {

std::string providerOf(const std::string &bookmarkableString) {
  const std::size_t begin = bookmarkableString.find(':') + 1;
  return bookmarkableString.substr(begin, bookmarkableString.find('/') - begin);
}

bool isStorixError(const SXError &error, SXErrorCode code) {
  return error.domain() == storixErrorDomain && error.code() == static_cast<std::int64_t>(code);
}

}  // namespace

SXError withAdvice(const SXError &error, const std::string &advice) {
  const std::string message = error.message();
  Dictionary details = error.details();
  details.insert_or_assign("description", message + (message.ends_with('.') ? " " : ". ") + advice);
  return SXError(error.domain(), error.code(), std::move(details));
}

SXError adviseOnResolving(const SXError &error, const std::string &bookmarkableString) {
  const std::string provider = providerOf(bookmarkableString);
  if (isClientError(error, ClientErrorCode::timedOut)) {
    return withAdvice(error, "It never does for a provider that is not installed: \"storixctl providers\" must list “" +
                                 provider + "”. If it does, try a longer --timeout.");
  }
  if (isStorixError(error, SXErrorCode::notPermitted)) {
    return withAdvice(error, "\"storixctl extend DOCUMENT " + provider +
                                 " CONSUMER\" grants it, where CONSUMER is the identifier under which this program is "
                                 "installed.");
  }
  return error;
}

SXError adviseOnReaching(const SXError &error) {
  if (!isClientError(error, ClientErrorCode::notReachable)) return error;
  return withAdvice(error, "Start storixd, with the same STORIX_RUNTIME_DIR or XDG_RUNTIME_DIR as this program has.");
}

}  // namespace storix::ctl
