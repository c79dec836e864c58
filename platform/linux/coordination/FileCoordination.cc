#include "platform/linux/coordination/FileCoordination.h"

#include <algorithm>
#include <cerrno>
#include <condition_variable>
#include <cstring>
#include <map>
#include <mutex>
#include <set>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

#include "platform/linux/HostErrors.h"
#include "platform/linux/coordination/ClaimIndex.h"
#include "platform/linux/files/PathText.h"
#include "platform/linux/files/ResolvedPath.h"

namespace storix::linuxhost {

namespace {

using ConnectionNumber = std::uint64_t;
using QuestionNumber = std::uint64_t;
using ReaderNumber = std::uint64_t;

/// A registered provider object. What it says of itself is asked once, when it is added.
struct RegisteredProvider {
  std::shared_ptr<KTStorix> object;
  std::shared_ptr<OperationQueue> queue;
  std::optional<URL> url;
  /// Of its directory, resolved; empty when it has none.
  std::string path;
  std::optional<std::string> identifier;

  // Guarded by the service's mutex.
  bool withdrawn = false;
  std::vector<std::thread::id> callers;

  /// Its own URL of a file in its directory, by whatever name the file was reached.
  [[nodiscard]] URL urlOf(std::string_view resolvedPath, bool isDirectory) const {
    const std::optional<std::string_view> rest = pathBelow(path, resolvedPath);
    return url->appendingPathComponent(rest.value_or(std::string_view()), isDirectory);
  }
};

/// What is claimed, and by whom.
struct Place {
  ConnectionNumber connection = 0;
  std::string path;
  bool isDirectory = false;
  std::shared_ptr<const Peer> peer;
  /// The reader ID or writer ID.
  std::optional<std::string> party;
};

struct Claim {
  Place place;
  ClaimIndex::Kind kind = ClaimIndex::Kind::shared;
  /// Empty once it has been called.
  ClaimHandler handler;
};

struct Reader {
  Place place;
  ClaimHandler handler;
};

/// A provider that is asked to provide a file, and those who wait for its answer, in the order in which
/// they came.
struct Question {
  std::shared_ptr<RegisteredProvider> provider;
  std::string path;
  std::map<ReaderNumber, Reader> readers;
};

struct Connection {
  std::size_t count = 0;  ///< Claims and readers.
  std::set<ClaimIndex::Number> claims;
  std::set<std::pair<QuestionNumber, ReaderNumber>> readers;
};

CoordinationFailure unavailable(std::string text) { return {CoordinationFailure::Kind::unavailable, std::move(text)}; }

CoordinationFailure noSuchClaim() {
  return {CoordinationFailure::Kind::noSuchClaim, "This connection has no such claim."};
}

Task answering(ClaimHandler handler, ClaimOutcome outcome) {
  return [handler = std::move(handler), outcome = std::move(outcome)] {
    if (handler) handler(outcome);
  };
}

}  // namespace

class FileCoordination::State : public std::enable_shared_from_this<State> {
 public:
  State(Executor &executor, IsProviderProcess isProviderProcess)
      : executor_(executor), isProviderProcess_(std::move(isProviderProcess)) {}

  void end();
  void addProvider(std::shared_ptr<KTStorix> object);
  void removeProvider(const std::shared_ptr<KTStorix> &object);

  ConnectionNumber addConnection();
  void endConnection(ConnectionNumber connection);
  void begin(ClaimIndex::Kind kind, Place place, ClaimHandler handler);
  std::optional<CoordinationFailure> endClaim(ConnectionNumber connection, ClaimIndex::Number number,
                                              ClaimIndex::Kind kind);

  /// The provider has answered the question; only the first time counts.
  void answered(QuestionNumber question, const std::optional<SXError> &error);

 private:
  /// What is to be done when the mutex is no longer held: handlers to run, and things to be destroyed.
  using Afterwards = std::vector<Task>;

  std::shared_ptr<RegisteredProvider> providerOf(std::string_view path) const;
  bool isProcessOf(const RegisteredProvider &provider, const std::shared_ptr<const Peer> &peer) const;
  std::optional<CoordinationFailure> charge(const Place &place);
  void discharge(const Place &place);
  void claim(ClaimIndex::Kind kind, Place place, ClaimHandler handler, Afterwards &afterwards);
  void tellNowHeld(const std::vector<ClaimIndex::Number> &nowHeld, Afterwards &afterwards);
  void ask(const std::shared_ptr<RegisteredProvider> &provider, QuestionNumber question, URL url,
           std::optional<std::string> readerID);
  void tellOfWrite(const std::shared_ptr<RegisteredProvider> &provider, const Place &place);
  template <class Function>
  bool callProvider(RegisteredProvider &provider, Function function);
  void run(Afterwards &afterwards);

  Executor &executor_;
  const IsProviderProcess isProviderProcess_;

  mutable std::mutex mutex_;
  std::condition_variable callbackEnded_;
  bool ended_ = false;
  std::vector<std::shared_ptr<RegisteredProvider>> providers_;
  /// By their resolved directories; of several with one directory the last to be added counts.
  std::map<std::string, std::vector<std::shared_ptr<RegisteredProvider>>, std::less<>> directories_;
  ClaimIndex index_;
  std::map<ClaimIndex::Number, Claim> claims_;
  QuestionNumber lastQuestion_ = 0;
  std::map<QuestionNumber, Question> questions_;
  ReaderNumber lastReader_ = 0;
  std::map<std::pair<const RegisteredProvider *, std::string>, QuestionNumber> openQuestions_;
  ConnectionNumber lastConnection_ = 0;
  std::map<ConnectionNumber, Connection> connections_;
  std::size_t components_ = 0;
};

namespace {

/// The completion of one question to a provider: the first call counts, and letting go of it without a
/// call is an answer too.
template <class State>
class Answer {
 public:
  Answer(std::weak_ptr<State> state, QuestionNumber question) : state_(std::move(state)), question_(question) {}
  Answer(const Answer &) = delete;
  Answer &operator=(const Answer &) = delete;
  ~Answer() {
    give(hostError(HostErrorCode::noAnswer, "The provider let go of the request to provide without answering it."));
  }
  void give(const std::optional<SXError> &error) const {
    if (const std::shared_ptr<State> state = state_.lock()) state->answered(question_, error);
  }

 private:
  std::weak_ptr<State> state_;
  QuestionNumber question_;
};

}  // namespace

// --- Providers

void FileCoordination::State::addProvider(std::shared_ptr<KTStorix> object) {
  if (!object) return;
  auto provider = std::make_shared<RegisteredProvider>();
  provider->queue = object->_providedItemsOperationQueue();
  provider->url = object->_providedItemsURL();
  if (object->answers(KTStorix::OptionalMember::fileReactorID)) provider->identifier = object->_fileReactorID();
  if (provider->url && provider->queue) {
    const std::string path = provider->url->fileSystemRepresentation();
    const std::optional<ResolvedPath> resolved = resolvePath(path);
    provider->path = resolved ? resolved->path : path;
  }
  provider->object = std::move(object);

  const std::lock_guard lock(mutex_);
  const bool known = std::any_of(providers_.begin(), providers_.end(),
                                 [&provider](const auto &other) { return other->object == provider->object; });
  if (ended_ || known) return;
  if (!provider->path.empty()) directories_[provider->path].push_back(provider);
  providers_.push_back(std::move(provider));
}

void FileCoordination::State::removeProvider(const std::shared_ptr<KTStorix> &object) {
  std::shared_ptr<KTStorix> released;
  std::unique_lock lock(mutex_);
  const auto found = std::find_if(providers_.begin(), providers_.end(),
                                  [&object](const auto &other) { return other->object == object; });
  if (found == providers_.end()) return;
  const std::shared_ptr<RegisteredProvider> provider = *found;
  providers_.erase(found);
  if (const auto directory = directories_.find(provider->path); directory != directories_.end()) {
    std::erase(directory->second, provider);
    if (directory->second.empty()) directories_.erase(directory);
  }
  provider->withdrawn = true;
  released = std::move(provider->object);
  const auto &callers = provider->callers;
  if (std::find(callers.begin(), callers.end(), std::this_thread::get_id()) != callers.end()) return;
  if (callers.empty()) return;
  const BlockingScope blocking(executor_);
  callbackEnded_.wait(lock, [&callers] { return callers.empty(); });
}

/// Calls the provider with nothing locked. False when it has been withdrawn: nothing is called then.
template <class Function>
bool FileCoordination::State::callProvider(RegisteredProvider &provider, Function function) {
  std::shared_ptr<KTStorix> object;
  {
    const std::lock_guard lock(mutex_);
    if (provider.withdrawn) return false;
    object = provider.object;
    provider.callers.push_back(std::this_thread::get_id());
  }
  function(*object);
  {
    const std::lock_guard lock(mutex_);
    auto &callers = provider.callers;
    callers.erase(std::find(callers.begin(), callers.end(), std::this_thread::get_id()));
  }
  callbackEnded_.notify_all();
  return true;
}

std::shared_ptr<RegisteredProvider> FileCoordination::State::providerOf(std::string_view path) const {
  for (std::size_t slash = path.rfind('/'); slash != std::string_view::npos; slash = path.rfind('/', slash - 1)) {
    const auto found = directories_.find(path.substr(0, std::max<std::size_t>(slash, 1)));
    if (found != directories_.end() && found->first != path) return found->second.back();
    if (slash == 0) break;
  }
  return nullptr;
}

bool FileCoordination::State::isProcessOf(const RegisteredProvider &provider,
                                          const std::shared_ptr<const Peer> &peer) const {
  if (!peer || !provider.identifier || !isProviderProcess_) return false;
  // The peer had its number before the question and has it after the answer, so the number was its own.
  return isProviderProcess_(*provider.identifier, peer->processIdentifier()) && peer->isAlive();
}

void FileCoordination::State::ask(const std::shared_ptr<RegisteredProvider> &provider, QuestionNumber question, URL url,
                                  std::optional<std::string> readerID) {
  provider->queue->addOperation(
      [weak = weak_from_this(), provider, question, url = std::move(url), readerID = std::move(readerID)] {
        const std::shared_ptr<State> state = weak.lock();
        if (!state) return;
        const bool called = state->callProvider(*provider, [&weak, question, &url, &readerID](KTStorix &object) {
          const auto answer = std::make_shared<Answer<State>>(weak, question);
          KTStorix::Completion completion = [answer](const std::optional<SXError> &error) { answer->give(error); };
          if (object.answers(KTStorix::OptionalMember::provideItemAtURLToReaderWithID)) {
            object._provideItemAtURL(url, readerID, std::move(completion));
          } else {
            object._provideItemAtURL(url, std::move(completion));
          }
        });
        // Withdrawn meanwhile: a file like any other.
        if (!called) state->answered(question, std::nullopt);
      });
}

void FileCoordination::State::answered(QuestionNumber number, const std::optional<SXError> &error) {
  Afterwards afterwards;
  Question question;
  {
    const std::lock_guard lock(mutex_);
    const auto found = questions_.find(number);
    if (found == questions_.end()) return;
    question = std::move(found->second);
    questions_.erase(found);
    openQuestions_.erase({question.provider.get(), question.path});
    for (auto &[readerNumber, reader] : question.readers) {
      connections_.at(reader.place.connection).readers.erase({number, readerNumber});
      if (error) {
        discharge(reader.place);
        afterwards.push_back(answering(std::move(reader.handler), *error));
      } else {
        claim(ClaimIndex::Kind::shared, std::move(reader.place), std::move(reader.handler), afterwards);
      }
    }
  }
  run(afterwards);
}

void FileCoordination::State::tellOfWrite(const std::shared_ptr<RegisteredProvider> &provider, const Place &place) {
  provider->queue->addOperation([weak = weak_from_this(), provider, writerID = place.party,
                                 url = provider->urlOf(place.path, place.isDirectory)] {
    const std::shared_ptr<State> state = weak.lock();
    if (!state) return;
    (void)state->callProvider(*provider, [&writerID, &url](KTStorix &object) {
      if (object.answers(KTStorix::OptionalMember::writerWithIDDidFinishWritingForURL)) {
        object._writerWithID(writerID, url);
      }
    });
  });
}

// --- Claims

ConnectionNumber FileCoordination::State::addConnection() {
  const std::lock_guard lock(mutex_);
  connections_[++lastConnection_];
  return lastConnection_;
}

std::optional<CoordinationFailure> FileCoordination::State::charge(const Place &place) {
  const std::size_t components = ClaimIndex::componentsOf(place.path);
  Connection &connection = connections_.at(place.connection);
  if (connection.count >= claimsPerConnection) {
    return CoordinationFailure{CoordinationFailure::Kind::busy,
                               "This connection has " + std::to_string(claimsPerConnection) + " claims already."};
  }
  if (components > componentsAltogether - components_) {
    return CoordinationFailure{CoordinationFailure::Kind::busy, "There are too many claims on files."};
  }
  ++connection.count;
  components_ += components;
  return std::nullopt;
}

void FileCoordination::State::discharge(const Place &place) {
  components_ -= ClaimIndex::componentsOf(place.path);
  const auto connection = connections_.find(place.connection);
  if (connection != connections_.end()) --connection->second.count;
}

void FileCoordination::State::begin(ClaimIndex::Kind kind, Place place, ClaimHandler handler) {
  const std::optional<ResolvedPath> resolved = resolvePath(place.path);
  const int problem = errno;
  std::shared_ptr<RegisteredProvider> provider;
  if (resolved && kind == ClaimIndex::Kind::shared) {
    {
      const std::lock_guard lock(mutex_);
      provider = providerOf(resolved->path);
    }
    if (provider && isProcessOf(*provider, place.peer)) provider = nullptr;
  }

  Afterwards afterwards;
  std::optional<std::pair<QuestionNumber, URL>> newQuestion;
  const std::optional<std::string> party = place.party;
  {
    const std::lock_guard lock(mutex_);
    if (ended_ || !connections_.contains(place.connection)) return;
    std::optional<CoordinationFailure> failure;
    if (!resolved) {
      failure = unavailable("Cannot look at " + quotedPath(place.path) + ": " + std::strerror(problem) + ".");
    } else {
      place.path = resolved->path;
      failure = charge(place);
    }
    if (failure) {
      afterwards.push_back(answering(std::move(handler), *std::move(failure)));
    } else if (!provider || provider->withdrawn) {
      claim(kind, std::move(place), std::move(handler), afterwards);
    } else {
      const auto [open, isNew] = openQuestions_.try_emplace({provider.get(), place.path}, lastQuestion_ + 1);
      const QuestionNumber number = open->second;
      Question &question = questions_[number];
      if (isNew) {
        lastQuestion_ = number;
        question.provider = provider;
        question.path = place.path;
        newQuestion.emplace(number, provider->urlOf(place.path, place.isDirectory));
      }
      connections_.at(place.connection).readers.emplace(number, ++lastReader_);
      question.readers.emplace(lastReader_, Reader{std::move(place), std::move(handler)});
    }
  }
  if (newQuestion) ask(provider, newQuestion->first, std::move(newQuestion->second), party);
  run(afterwards);
}

void FileCoordination::State::claim(ClaimIndex::Kind kind, Place place, ClaimHandler handler, Afterwards &afterwards) {
  const ClaimIndex::Number number = index_.add(place.path, kind);
  connections_.at(place.connection).claims.insert(number);
  if (index_.isHeld(number)) afterwards.push_back(answering(std::exchange(handler, nullptr), number));
  claims_.emplace(number, Claim{std::move(place), kind, std::move(handler)});
}

std::optional<CoordinationFailure> FileCoordination::State::endClaim(ConnectionNumber connection,
                                                                     ClaimIndex::Number number, ClaimIndex::Kind kind) {
  Place place;
  std::shared_ptr<RegisteredProvider> provider;
  {
    const std::lock_guard lock(mutex_);
    const auto found = claims_.find(number);
    if (found == claims_.end() || found->second.place.connection != connection || found->second.kind != kind ||
        !index_.isHeld(number)) {
      return noSuchClaim();
    }
    place = std::move(found->second.place);
    claims_.erase(found);
    connections_.at(connection).claims.erase(number);
    if (kind == ClaimIndex::Kind::exclusive) provider = providerOf(place.path);
  }
  // The provider hears of the write before the next claim on the file is given.
  if (provider && !isProcessOf(*provider, place.peer)) tellOfWrite(provider, place);

  Afterwards afterwards;
  {
    const std::lock_guard lock(mutex_);
    discharge(place);
    if (!ended_) tellNowHeld(index_.remove(number), afterwards);
  }
  run(afterwards);
  return std::nullopt;
}

void FileCoordination::State::tellNowHeld(const std::vector<ClaimIndex::Number> &nowHeld, Afterwards &afterwards) {
  for (const ClaimIndex::Number number : nowHeld) {
    const auto found = claims_.find(number);
    if (found == claims_.end()) continue;
    afterwards.push_back(answering(std::exchange(found->second.handler, nullptr), number));
  }
}

void FileCoordination::State::endConnection(ConnectionNumber number) {
  Afterwards afterwards;
  std::vector<ClaimHandler> dropped;
  {
    const std::lock_guard lock(mutex_);
    const auto connection = connections_.extract(number);
    if (connection.empty()) return;
    for (const auto &[question, readerNumber] : connection.mapped().readers) {
      const auto reader = questions_.at(question).readers.extract(readerNumber);
      discharge(reader.mapped().place);
      dropped.push_back(std::move(reader.mapped().handler));
    }
    std::vector<ClaimIndex::Number> nowHeld;
    for (const ClaimIndex::Number claim : connection.mapped().claims) {
      const auto found = claims_.extract(claim);
      discharge(found.mapped().place);
      dropped.push_back(std::move(found.mapped().handler));
      const std::vector<ClaimIndex::Number> more = index_.remove(claim);
      nowHeld.insert(nowHeld.end(), more.begin(), more.end());
    }
    tellNowHeld(nowHeld, afterwards);
  }
  run(afterwards);
}

void FileCoordination::State::run(Afterwards &afterwards) {
  for (Task &task : afterwards) executor_.execute(std::move(task));
}

void FileCoordination::State::end() {
  // Swapped out, so that what they hold is let go of without the mutex.
  std::vector<std::shared_ptr<RegisteredProvider>> providers;
  std::map<ClaimIndex::Number, Claim> claims;
  std::map<QuestionNumber, Question> questions;
  {
    const std::lock_guard lock(mutex_);
    ended_ = true;
    for (const auto &provider : providers_) provider->withdrawn = true;
    providers.swap(providers_);
    directories_.clear();
    claims.swap(claims_);
    questions.swap(questions_);
    openQuestions_.clear();
    connections_.clear();
  }
}

/// The claims of one connection, which the state knows by a number.
class FileCoordination::ConnectionClaims : public FileClaims {
 public:
  ConnectionClaims(std::shared_ptr<State> state, std::shared_ptr<const Peer> peer)
      : state_(std::move(state)), peer_(std::move(peer)), number_(state_->addConnection()) {}
  ~ConnectionClaims() override { state_->endConnection(number_); }

  void beginRead(const URL &url, std::optional<std::string> readerID, ClaimHandler handler) override {
    state_->begin(ClaimIndex::Kind::shared, place(url, std::move(readerID)), std::move(handler));
  }
  void beginWrite(const URL &url, std::optional<std::string> writerID, ClaimHandler handler) override {
    state_->begin(ClaimIndex::Kind::exclusive, place(url, std::move(writerID)), std::move(handler));
  }
  std::optional<CoordinationFailure> endRead(ClaimIdentifier claim) override {
    return state_->endClaim(number_, claim, ClaimIndex::Kind::shared);
  }
  std::optional<CoordinationFailure> endWrite(ClaimIdentifier claim) override {
    return state_->endClaim(number_, claim, ClaimIndex::Kind::exclusive);
  }

 private:
  [[nodiscard]] Place place(const URL &url, std::optional<std::string> party) const {
    return {number_, url.fileSystemRepresentation(), url.hasDirectoryPath(), peer_, std::move(party)};
  }

  const std::shared_ptr<State> state_;
  const std::shared_ptr<const Peer> peer_;
  const ConnectionNumber number_;
};

FileCoordination::FileCoordination(Executor &executor, IsProviderProcess isProviderProcess)
    : state_(std::make_shared<State>(executor, std::move(isProviderProcess))) {}

FileCoordination::~FileCoordination() { state_->end(); }

void FileCoordination::addProvider(std::shared_ptr<KTStorix> provider) { state_->addProvider(std::move(provider)); }

void FileCoordination::removeProvider(const std::shared_ptr<KTStorix> &provider) { state_->removeProvider(provider); }

std::unique_ptr<FileClaims> FileCoordination::claimsOf(std::shared_ptr<const Peer> peer) {
  return std::make_unique<ConnectionClaims>(state_, std::move(peer));
}

}  // namespace storix::linuxhost
