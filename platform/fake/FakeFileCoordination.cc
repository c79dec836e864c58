#include "platform/fake/FakeFileCoordination.h"

#include <algorithm>
#include <atomic>

#include "platform/Log.h"

namespace storix::fake {
namespace {

std::string nameOf(KTStorix &provider) {
  if (!provider.answers(KTStorix::OptionalMember::fileReactorID)) return "a provider without a name";
  return traced(provider._fileReactorID());
}

/// By the texts of the paths alone: no links, no "..".
bool holds(const URL &directory, const URL &item) {
  const std::string above = directory.path() == "/" ? "/" : directory.path() + "/";
  return item.path().starts_with(above);
}

}  // namespace

void FakeFileCoordination::addProvider(std::shared_ptr<KTStorix> provider) {
  trace_.add("addProvider " + nameOf(*provider));
  const std::lock_guard lock(mutex_);
  providers_.push_back(std::move(provider));
}

void FakeFileCoordination::removeProvider(const std::shared_ptr<KTStorix> &provider) {
  trace_.add("removeProvider " + nameOf(*provider));
  const std::lock_guard lock(mutex_);
  std::erase(providers_, provider);
}

std::vector<std::shared_ptr<KTStorix>> FakeFileCoordination::providers() const {
  const std::lock_guard lock(mutex_);
  return providers_;
}

std::shared_ptr<KTStorix> FakeFileCoordination::providerFor(const URL &url) const {
  // A copy, since a provider may wait for a queue of its own when asked for its directory.
  for (const std::shared_ptr<KTStorix> &provider : providers()) {
    const std::optional<URL> directory = provider->_providedItemsURL();
    if (directory && holds(*directory, url)) return provider;
  }
  return nullptr;
}

bool FakeFileCoordination::isRegistered(const std::shared_ptr<KTStorix> &provider) const {
  const std::lock_guard lock(mutex_);
  return std::find(providers_.begin(), providers_.end(), provider) != providers_.end();
}

void FakeFileCoordination::ask(const std::shared_ptr<KTStorix> &provider, Question question) {
  provider->_providedItemsOperationQueue()->addOperation([this, provider, question = std::move(question)] {
    if (isRegistered(provider)) question(*provider);
  });
}

KTStorix::Completion FakeFileCoordination::tracedOnce(const URL &url, KTStorix::Completion completion) {
  auto isAnswered = std::make_shared<std::atomic<bool>>(false);
  return [this, url, isAnswered, completion = std::move(completion)](std::optional<SXError> error) {
    const bool isFirst = !isAnswered->exchange(true);
    trace_.add((isFirst ? "provided " : "provided again ") + url.absoluteString() + " " +
               escapedForLog(logDescription(error)) + " on " + currentContext());
    if (isFirst && completion) completion(std::move(error));
  };
}

bool FakeFileCoordination::read(const URL &url, std::optional<std::string> readerID, KTStorix::Completion completion) {
  const std::shared_ptr<KTStorix> provider = providerFor(url);
  if (!provider) return false;
  if (!provider->answers(KTStorix::OptionalMember::provideItemAtURLToReaderWithID)) {
    return readWithoutReader(url, std::move(completion));
  }
  trace_.add("coordinated read " + url.absoluteString() + " by " + traced(readerID));
  ask(provider, [url, readerID = std::move(readerID), once = tracedOnce(url, std::move(completion))](KTStorix &asked) {
    asked._provideItemAtURL(url, readerID, once);
  });
  return true;
}

bool FakeFileCoordination::readWithoutReader(const URL &url, KTStorix::Completion completion) {
  const std::shared_ptr<KTStorix> provider = providerFor(url);
  if (!provider) return false;
  trace_.add("coordinated read " + url.absoluteString());
  ask(provider,
      [url, once = tracedOnce(url, std::move(completion))](KTStorix &asked) { asked._provideItemAtURL(url, once); });
  return true;
}

bool FakeFileCoordination::cancelRead(const URL &url, std::optional<std::string> readerID) {
  const std::shared_ptr<KTStorix> provider = providerFor(url);
  if (!provider || !provider->answers(KTStorix::OptionalMember::cancelProvidingItemAtURLToReaderWithID)) return false;
  trace_.add("coordinated read given up " + url.absoluteString() + " by " + traced(readerID));
  ask(provider,
      [url, readerID = std::move(readerID)](KTStorix &asked) { asked._cancelProvidingItemAtURL(url, readerID); });
  return true;
}

bool FakeFileCoordination::finishWriting(const URL &url, std::optional<std::string> writerID) {
  const std::shared_ptr<KTStorix> provider = providerFor(url);
  if (!provider || !provider->answers(KTStorix::OptionalMember::writerWithIDDidFinishWritingForURL)) return false;
  trace_.add("coordinated write finished " + url.absoluteString() + " by " + traced(writerID));
  ask(provider, [url, writerID = std::move(writerID)](KTStorix &asked) { asked._writerWithID(writerID, url); });
  return true;
}

bool FakeFileCoordination::gainPresenter(const URL &url, std::optional<std::string> presenterID) {
  const std::shared_ptr<KTStorix> provider = providerFor(url);
  if (!provider || !provider->answers(KTStorix::OptionalMember::providedItemAtURLDidGainPresenterWithID)) return false;
  trace_.add("presenter gained " + url.absoluteString() + " " + traced(presenterID));
  ask(provider, [url, presenterID = std::move(presenterID)](KTStorix &asked) {
    asked._providedItemAtURLDidGainPresenterWithID(url, presenterID);
  });
  return true;
}

bool FakeFileCoordination::losePresenter(const URL &url, std::optional<std::string> presenterID) {
  const std::shared_ptr<KTStorix> provider = providerFor(url);
  if (!provider || !provider->answers(KTStorix::OptionalMember::providedItemAtURLDidLosePresenterWithID)) return false;
  trace_.add("presenter lost " + url.absoluteString() + " " + traced(presenterID));
  ask(provider, [url, presenterID = std::move(presenterID)](KTStorix &asked) {
    asked._providedItemAtURLDidLosePresenterWithID(url, presenterID);
  });
  return true;
}

bool FakeFileCoordination::movePresented(const URL &url, std::optional<std::string> presenterID, const URL &newURL) {
  const std::shared_ptr<KTStorix> provider = providerFor(url);
  if (!provider || !provider->answers(KTStorix::OptionalMember::providedItemAtURLWithPresenterWithIDDidMoveToURL)) {
    return false;
  }
  trace_.add("presenter moved " + url.absoluteString() + " " + traced(presenterID) + " to " + newURL.absoluteString());
  ask(provider, [url, presenterID = std::move(presenterID), newURL](KTStorix &asked) {
    asked._providedItemAtURLWithPresenterWithIDDidMoveToURL(url, presenterID, newURL);
  });
  return true;
}

void FakeFileCoordination::clear() {
  std::vector<std::shared_ptr<KTStorix>> dropped;
  const std::lock_guard lock(mutex_);
  dropped.swap(providers_);
}

}  // namespace storix::fake
