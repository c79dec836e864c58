#include "examples/webdav-provider/WebDavProvider.h"

#include <cerrno>
#include <cstdio>
#include <utility>

#include "examples/webdav-provider/Configuration.h"
#include "examples/webdav-provider/DavPath.h"
#include "examples/webdav-provider/Placeholders.h"

namespace storix::example {

namespace {

constexpr int conflictsInARow = 8;

std::string joined(const std::string &directory, const std::string &name) {
  return directory.empty() ? name : directory + "/" + name;
}

}  // namespace

WebDavProvider::WebDavProvider(ProviderEnvironment environment)
    : WebDavProvider(std::move(environment), &readConfiguration) {}

WebDavProvider::WebDavProvider(ProviderEnvironment environment, Configure configure)
    : ProviderExtension(std::move(environment)),
      configure_(std::move(configure)),
      daemonGone_(cancellation(), [this] { ending_.request_stop(); }) {
  // Nothing has begun yet, so what nobody remembers is left from a process that ended early.
  const auto directory = providedItemsURL();
  if (!directory) return;
  const auto copies = LocalCopies::open(directory->path());
  const auto states = ItemStates::open(*this->environment().groupContainer);
  if (copies && states) copies.value().discardForgotten(states.value());
}

WebDavProvider::~WebDavProvider() {
  ending_.request_stop();
  if (catchingUp_.joinable()) catchingUp_.join();
}

void WebDavProvider::performInitialSetup(Completion completion) {
  std::optional<SXError> failed;
  ProviderExtension::performInitialSetup([&failed](std::optional<SXError> error) { failed = std::move(error); });
  if (failed) return completion(failed);
  auto opened = openWorkplace();
  if (!opened) return completion(opened.error());
  {
    const std::lock_guard lock(mutex_);
    workplace_ = opened.value();
    if (!isCatchingUp_.exchange(true)) {
      if (catchingUp_.joinable()) catchingUp_.join();
      catchingUp_ = std::thread([this] { catchUp(); });
    }
  }
  completion(std::nullopt);
}

void WebDavProvider::providePlaceholder(const URL &url, URLCompletion completion) {
  const auto path = pathOf(url);
  if (!path) return completion(path.error());
  completion(writePlaceholders(path.value()));
}

void WebDavProvider::startProviding(const URL &url, Completion completion) {
  const auto path = pathOf(url);
  if (!path) return completion(path.error());
  completion(work(path.value(), &DocumentSync::provide));
}

void WebDavProvider::itemChanged(const URL &url, Completion completion) {
  const auto path = pathOf(url);
  if (!path) return completion(path.error());
  completion(work(path.value(), &DocumentSync::upload));
}

void WebDavProvider::stopProviding(const URL &url, Completion completion) {
  const auto path = pathOf(url);
  if (!path) return completion(path.error());
  auto place = workplace();
  if (!place) return completion(place.error());
  auto local = place.value()->copies.find(path.value());
  if (!local) return completion(local.error());
  if (local.value()) {
    local.value().reset();
    if (auto failed = work(path.value(), &DocumentSync::upload)) return completion(failed);
  }
  const ItemTurns::Turn turn(turns_, path.value(), ending_.get_token());
  if (!turn) return completion(posixError(ECANCELED, "dropping \"" + path.value() + "\""));
  DocumentSync sync(place.value()->client, place.value()->copies, place.value()->states, ending_.get_token());
  completion(sync.evict(path.value()));
}

void WebDavProvider::itemIdentifier(const URL &url, IdentifierCompletion completion) {
  // The server is not asked: an identifier is needed quickly, and for what is only here as well.
  auto path = pathOf(url);
  if (path && !isUTF8(path.value())) {
    return completion(posixError(EILSEQ, "naming the document at " + url.absoluteString()));
  }
  completion(std::move(path));
}

void WebDavProvider::itemURL(const std::string &identifier, URLCompletion completion) {
  if (auto refused = FolderTree::checkPath(identifier)) return completion(*refused);
  ProviderExtension::itemURL(identifier, std::move(completion));
}

Result<std::shared_ptr<WebDavProvider::Workplace>> WebDavProvider::workplace() {
  const std::lock_guard lock(mutex_);
  if (!workplace_) {
    auto opened = openWorkplace();
    if (!opened) return opened.error();
    workplace_ = std::move(opened.value());
  }
  return workplace_;
}

Result<std::shared_ptr<WebDavProvider::Workplace>> WebDavProvider::openWorkplace() const {
  const auto &container = environment().groupContainer;
  const auto directory = providedItemsURL();
  if (!container || !directory) {
    return posixError(ENOENT, "looking for the group container of " + environment().bundlePath);
  }
  auto settings = configure_(*container);
  if (!settings) return settings.error();
  auto copies = LocalCopies::open(directory->path());
  if (!copies) return copies.error();
  auto states = ItemStates::open(*container);
  if (!states) return states.error();
  return std::make_shared<Workplace>(std::move(settings.value()), std::move(copies.value()), std::move(states.value()));
}

Result<std::string> WebDavProvider::pathOf(const URL &url) const {
  auto path = relativePath(url);
  if (!path) return posixError(EINVAL, "looking for a document of this provider at " + url.absoluteString());
  if (auto refused = FolderTree::checkPath(*path)) return *refused;
  return *path;
}

std::optional<SXError> WebDavProvider::work(const std::string &path,
                                            DocumentSync::Outcome (DocumentSync::*step)(const std::string &)) {
  auto place = workplace();
  if (!place) return place.error();
  DocumentSync sync(place.value()->client, place.value()->copies, place.value()->states, ending_.get_token());
  std::string next = path;
  for (int conflicts = 0; conflicts < conflictsInARow; ++conflicts) {
    DocumentSync::Outcome outcome;
    {
      const ItemTurns::Turn turn(turns_, next, ending_.get_token());
      if (!turn) return posixError(ECANCELED, "working on \"" + next + "\"");
      outcome = (sync.*step)(next);
    }
    if (outcome.conflict) {
      std::fprintf(stderr, "\"%s\" was changed here and on the server; what was here is now \"%s\".\n", next.c_str(),
                   outcome.conflict->c_str());
    }
    if (outcome.error) {
      // What is kept under another name is safe here, and uploaded the next time.
      return next != path && isUnreachable(*outcome.error) ? std::nullopt : outcome.error;
    }
    if (!outcome.conflict) return std::nullopt;
    next = *std::move(outcome.conflict);
    step = &DocumentSync::upload;
  }
  return std::nullopt;
}

Result<URL> WebDavProvider::writePlaceholders(const std::string &path) {
  auto place = workplace();
  if (!place) return place.error();
  auto entry = place.value()->client.entry(path, ending_.get_token());
  if (!entry) return entry.error();
  if (!entry.value()) return posixError(ENOENT, "looking for \"" + path + "\" on the server");
  if (entry.value()->isCollection) {
    if (auto failed = place.value()->copies.makeDirectory(path)) return *failed;
    if (auto failed = writePlaceholdersIn(*place.value(), path)) return *failed;
    return providedItemsURL()->appendingPathComponent(path, true);
  }
  const auto companion = writePlaceholder(place.value()->copies, path, *entry.value());
  if (!companion) return companion.error();
  return providedItemsURL()->appendingPathComponent(companion.value());
}

std::optional<SXError> WebDavProvider::writePlaceholdersIn(Workplace &place, const std::string &path) {
  auto entries = place.client.list(path, ending_.get_token());
  if (!entries) return entries.error();
  for (const DavEntry &entry : entries.value()) {
    const std::string item = joined(path, entry.path);
    // Of what is further down the server was not asked; what has no name here is not served.
    if (entry.path.find('/') != std::string::npos || FolderTree::checkPath(item) || !isUTF8(item)) continue;
    if (entry.isCollection) {
      if (auto failed = place.copies.makeDirectory(item)) return failed;
    } else if (const auto written = writePlaceholder(place.copies, item, entry);
               !written && written.error().code() != EEXIST) {
      return written.error();
    }
  }
  return std::nullopt;
}

void WebDavProvider::catchUp() {
  const auto complain = [this](const SXError &error) {
    if (!ending_.stop_requested()) std::fprintf(stderr, "%s\n", error.message().c_str());
  };
  if (auto place = workplace()) {
    const DocumentSync sync(place.value()->client, place.value()->copies, place.value()->states, ending_.get_token());
    for (const std::string &item : place.value()->copies.items()) {
      if (ending_.stop_requested()) break;
      if (!sync.mayHaveChanges(item)) continue;
      if (auto failed = work(item, &DocumentSync::upload)) complain(*failed);
    }
    if (auto failed = writePlaceholdersIn(*place.value(), "")) complain(*failed);
  }
  isCatchingUp_ = false;
}

}  // namespace storix::example
