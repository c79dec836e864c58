#include "storix/FileCoordinator.h"

#include <utility>

#include "sdk/src/Claims.h"
#include "sdk/src/ClientErrors.h"
#include "sdk/src/RequestThread.h"

namespace storix {

using sdk::Claim;

class FileCoordinator::Implementation {
 public:
  explicit Implementation(ClientOptions options)
      : thread(sdk::RequestThread::start()),
        start(std::make_shared<sdk::DaemonStart>(thread->loop(), options.runtimeDirectory)),
        claims(std::make_shared<sdk::Claims>(thread, std::move(options), start)) {}

  Result<FileClaim> wait(Claim::Kind kind, const URL &file, ClaimOptions options) const {
    return thread->wait<Result<FileClaim>>(
        [&](ClaimHandler handler) { claims->begin(kind, file, std::move(options), std::move(handler)); });
  }

  const std::shared_ptr<sdk::RequestThread> thread;
  const std::shared_ptr<sdk::DaemonStart> start;
  const std::shared_ptr<sdk::Claims> claims;
};

FileCoordinator::FileCoordinator(ClientOptions options)
    : implementation_(std::make_shared<Implementation>(std::move(options))) {}

FileCoordinator::~FileCoordinator() { implementation_->thread->end(); }

void FileCoordinator::read(const URL &file, ClaimOptions options, ClaimHandler handler) {
  implementation_->claims->begin(Claim::Kind::read, file, std::move(options), std::move(handler));
}

Result<FileClaim> FileCoordinator::read(const URL &file, ClaimOptions options) {
  return implementation_->wait(Claim::Kind::read, file, std::move(options));
}

void FileCoordinator::write(const URL &file, ClaimOptions options, ClaimHandler handler) {
  implementation_->claims->begin(Claim::Kind::write, file, std::move(options), std::move(handler));
}

Result<FileClaim> FileCoordinator::write(const URL &file, ClaimOptions options) {
  return implementation_->wait(Claim::Kind::write, file, std::move(options));
}

Result<URL> FileCoordinator::fileURL(std::string_view path) {
  if (auto url = URL::fileURLWithPath(path)) return *std::move(url);
  return sdk::clientError(ClientErrorCode::invalidPath,
                          "Not an absolute path: \"" + std::string(path) + "\". Give one that begins with \"/\".");
}

}  // namespace storix
