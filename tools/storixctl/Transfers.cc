#include "tools/storixctl/Transfers.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <optional>
#include <stop_token>
#include <system_error>
#include <thread>
#include <utility>

#include "storix/FileCoordinator.h"
#include "tools/storixctl/Advice.h"
#include "tools/storixctl/Await.h"
#include "tools/storixctl/ContentCopy.h"
#include "tools/storixctl/Json.h"
#include "tools/storixctl/Placeholder.h"
#include "tools/storixctl/ProgressLine.h"
#include "tools/storixctl/Replacement.h"

namespace storix::ctl {

namespace {

constexpr std::string_view bookmarkPrefix = "storix:";

/// A regular file's size; none of anything else.
std::optional<std::uint64_t> sizeOf(int descriptor) {
  struct stat status {};
  if (::fstat(descriptor, &status) != 0 || !S_ISREG(status.st_mode)) return std::nullopt;
  return static_cast<std::uint64_t>(status.st_size);
}

/// One call of a verb that moves content.
class Transfer {
 public:
  Transfer(const Invocation &invocation, Client &client, const Surroundings &surroundings)
      : invocation_(invocation),
        client_(client),
        surroundings_(surroundings),
        deadline_(invocation.timeout),
        coordinator_(clientOptions(invocation, surroundings)),
        line_(surroundings.terminal, subject(invocation), surroundings.waiting) {}

  Result<Printed> open() {
    const auto token = fromBase64(invocation_.operands[0]);
    if (!token) return posixError(EINVAL, "reading the token: it must be base64 text, as extend and resolve print it");
    const auto opened = openToken(*token);
    if (!opened) return opened.error();
    return deliver(opened.value().get(), nullptr);
  }

  Result<Printed> read() {
    if (namesBookmark()) {
      return posixError(EINVAL, "reading \"" + invocation_.operands[0] +
                                    "\": it is a bookmarkable string; \"cat\" prints what it names");
    }
    const auto url = documentURL(invocation_.operands[0], surroundings_.currentDirectory);
    if (!url) return url.error();
    const auto claim = claimForReading(url.value());
    if (!claim) return claim.error();
    const auto opened = openPath(url.value().path());
    if (!opened) return opened.error();
    return deliver(opened.value().get(), &claim.value());
  }

  Result<Printed> cat() {
    const auto document = resolve();
    if (!document) return document.error();
    if (!document.value().token) return noToken(document.value());
    const auto claim = claimForReading(document.value().url);
    if (!claim) return claim.error();
    const auto opened = openToken(*document.value().token);
    if (!opened) return opened.error();
    return deliver(opened.value().get(), &claim.value());
  }

  Result<Printed> write() {
    auto url = documentURL(invocation_.operands[0], surroundings_.currentDirectory);
    std::optional<Data> token;
    if (namesBookmark()) {
      auto document = resolve();
      if (!document) return document.error();
      url = document.value().url;
      token = document.value().token;
    }
    if (!url) return url.error();
    auto replacement = Replacement::of(url.value().path());
    if (!replacement && token && isOutOfReach(replacement.error())) return writeThrough(*token, url.value());
    if (!replacement) return replacement.error();
    // All of the content is there before anybody has to wait for us.
    const auto size = takeIn(replacement.value().descriptor());
    if (!size) return size.error();

    auto claim = claimForWriting(url.value());
    if (!claim) return claim.error();
    if (!claim.value().isHeld()) return claimLost("nothing was written");
    if (auto failed = replacement.value().takePlace()) return *std::move(failed);
    return written(url.value(), size.value(), std::move(claim.value()));
  }

 private:
  /// What progress is about. A token is a secret, and says nothing to people.
  static std::string subject(const Invocation &invocation) {
    const std::string &operand = invocation.operands[0];
    return invocation.verb->verb == Verb::open ? "document" : operand.substr(operand.rfind('/') + 1);
  }

  static ClientOptions clientOptions(const Invocation &invocation, const Surroundings &surroundings) {
    ClientOptions options = surroundings.clientOptions;
    options.timeout = invocation.timeout;
    return options;
  }

  [[nodiscard]] bool namesBookmark() const { return invocation_.operands[0].starts_with(bookmarkPrefix); }

  [[nodiscard]] static SXError noToken(const GrantedDocument &document) {
    return posixError(EACCES, "opening " + document.url.absoluteString() + ": the daemon issued no token for it");
  }

  static Result<bool> resultOf(const std::optional<SXError> &error) {
    return error ? Result<bool>(*error) : Result<bool>(true);
  }

  /// Waits for an answer, interruptibly, and shows that it does.
  template <class T>
  Result<T> answer(const std::function<void(std::function<void(Result<T>)>)> &start) {
    return await<T>(surroundings_.waiting, start, [this] { line_.show("waiting", std::nullopt, std::nullopt); });
  }

  Result<GrantedDocument> resolve() {
    const std::string &string = invocation_.operands[0];
    auto document = answer<GrantedDocument>(
        [&](Client::Handler<GrantedDocument> handler) { client_.resolveBookmark(string, std::move(handler)); });
    if (!document) return adviseOnResolving(document.error(), string);
    return document;
  }

  Result<UniqueFd> openToken(const Data &token) {
    return answer<UniqueFd>([&](Client::Handler<UniqueFd> handler) { client_.open(token, std::move(handler)); });
  }

  static Result<UniqueFd> openPath(const std::string &path) {
    // Not blocking, so that a pipe without a writer cannot hold us up.
    UniqueFd file(::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    struct stat status {};
    if (!file || ::fstat(file.get(), &status) != 0) return posixError(errno, "opening " + path);
    if (S_ISDIR(status.st_mode)) return posixError(EISDIR, "opening " + path);
    if (!S_ISREG(status.st_mode)) return posixError(EINVAL, "opening " + path + ", which is not a regular file");
    return file;
  }

  Result<FileClaim> claimForReading(const URL &url) {
    std::stop_source givenUp;
    auto claim = await<FileClaim>(
        surroundings_.waiting,
        [&](FileCoordinator::ClaimHandler handler) {
          coordinator_.read(url, claimOptions(givenUp), std::move(handler));
        },
        [this, &url] {
          if (!line_.isDue()) return;
          const Placeholder placeholder = readPlaceholder(url);
          line_.show(placeholder.received ? "downloading" : "waiting", placeholder.received, placeholder.size);
        });
    if (claim) return claim;
    givenUp.request_stop();
    if (!isClientError(claim.error(), ClientErrorCode::timedOut)) return claim.error();
    return withAdvice(claim.error(),
                      "Its provider has not put it in place, or somebody is still writing it: try a longer "
                      "--timeout.");
  }

  Result<FileClaim> claimForWriting(const URL &url) {
    std::stop_source givenUp;
    auto claim = answer<FileClaim>([&](FileCoordinator::ClaimHandler handler) {
      coordinator_.write(url, claimOptions(givenUp), std::move(handler));
    });
    if (claim) return claim;
    givenUp.request_stop();
    if (!isClientError(claim.error(), ClientErrorCode::timedOut)) return claim.error();
    return withAdvice(claim.error(),
                      "Somebody is still reading or writing the document: try a longer --timeout. Nothing was "
                      "written.");
  }

  [[nodiscard]] ClaimOptions claimOptions(const std::stop_source &givenUp) const {
    return {.deadline = deadline_, .cancellation = givenUp.get_token()};
  }

  [[nodiscard]] static SXError claimLost(const std::string &consequence) {
    return SXError(std::string(clientErrorDomain), static_cast<std::int64_t>(ClientErrorCode::connectionLost),
                   {{"description", "The daemon ended, and with it the claim on the document: " + consequence + "."}});
  }

  /// Whether it is the document's directory that this process has no access to.
  static bool isOutOfReach(const SXError &error) {
    const auto code = error.code();
    return error.domain() == posixErrorDomain &&
           (code == EACCES || code == EPERM || code == EROFS || code == ENOENT || code == ENOTDIR);
  }

  /// For a process whose sandbox lets it do no more than the token: the content is written over the old
  /// in place, once there is room for it.
  Result<Printed> writeThrough(const Data &token, const URL &url) {
    std::error_code noDirectory;
    const auto directory = std::filesystem::temp_directory_path(noDirectory);
    const UniqueFd content(::open(directory.c_str(), O_TMPFILE | O_RDWR | O_CLOEXEC, 0600));
    if (!content) return posixError(errno, "making a temporary file in " + directory.string());
    const auto size = takeIn(content.get());
    if (!size) return size.error();
    // What is written over must be there.
    if (const auto provided = claimForReading(url); !provided) return provided.error();
    auto claim = claimForWriting(url);
    if (!claim) return claim.error();
    const auto opened = openToken(token);
    if (!opened) return opened.error();
    if (!claim.value().isHeld()) return claimLost("nothing was written");
    if (auto failed = overwrite(opened.value().get(), content.get(), size.value())) return *std::move(failed);
    return written(url, size.value(), std::move(claim.value()));
  }

  static std::optional<SXError> overwrite(int document, int content, std::uint64_t size) {
    const auto length = static_cast<off_t>(size);
    // Not every file system can keep room; then it turns out when it is written.
    if (length > 0 && ::fallocate(document, FALLOC_FL_KEEP_SIZE, 0, length) != 0 && errno == ENOSPC) {
      return posixError(ENOSPC, "writing the document, of which nothing was changed");
    }
    ::lseek(content, 0, SEEK_SET);
    // Begun, it is not interrupted: half of it would be neither the old nor the new content.
    ProcessWaiting uninterrupted;
    const auto copied =
        ContentCopy{content, document, "the new content", "the document"}.run(uninterrupted, [](std::uint64_t) {});
    if (!copied) return copied.error();
    if (::ftruncate(document, length) != 0 || ::fsync(document) != 0) return posixError(errno, "writing the document");
    return std::nullopt;
  }

  /// Has the provider told of the change.
  Result<Printed> written(const URL &url, std::uint64_t size, FileClaim claim) {
    if (auto failed = endWriting(std::move(claim))) return *std::move(failed);
    return Printed{{{"URL", url}, {"size", static_cast<std::int64_t>(size)}}, ""};
  }

  std::optional<SXError> endWriting(FileClaim claim) {
    const auto ended = answer<bool>([this, &claim](const std::function<void(Result<bool>)> &handler) {
      ending_ = std::jthread([handler, claim = std::move(claim)]() mutable { handler(resultOf(claim.end())); });
    });
    if (ended || isClientError(ended.error(), ClientErrorCode::cancelled)) return std::nullopt;
    return withAdvice(ended.error(), "The document is written, but its provider may not have heard of it.");
  }

  /// Copies, with progress where nobody else uses the terminal.
  Result<std::uint64_t> copy(const ContentCopy &content, const std::string &doing) {
    const bool visible = ::isatty(content.from) != 1 && ::isatty(content.to) != 1;
    const auto size = sizeOf(content.from);
    if (!visible) line_.clear();
    auto copied = content.run(surroundings_.waiting, [&](std::uint64_t done) {
      if (visible) line_.show(doing, done, size);
    });
    line_.clear();
    return copied;
  }

  Result<std::uint64_t> takeIn(int to) {
    const std::string *input = invocation_.value(Option::input);
    if (!input) return copy({surroundings_.contentInput, to, "standard input", "the new content"}, "taking in");
    const UniqueFd file(::open(input->c_str(), O_RDONLY | O_NOCTTY | O_CLOEXEC));
    if (!file) return posixError(errno, "opening " + *input);
    return copy({file.get(), to, *input, "the new content"}, "taking in");
  }

  /// Content of a document goes where the command line says. `claim`, where there is one, must be held
  /// until all is copied.
  Result<Printed> deliver(int from, const FileClaim *claim) {
    const std::string *output = invocation_.value(Option::output);
    if (!output) {
      const auto size = copy({from, surroundings_.contentOutput, "the document", "standard output"}, "copying");
      if (!size) return size.error();
      if (claim && claim->lost()) return claimLost("what was printed may be of two states of it");
      return Printed{{}, ""};
    }
    struct stat status {};
    const bool special = ::stat(output->c_str(), &status) == 0 && !S_ISREG(status.st_mode) && !S_ISDIR(status.st_mode);
    auto size = special ? deliverInto(*output, from) : deliverInPlaceOf(*output, from, claim);
    if (!size) return size.error();
    return Printed{{{"output", *output}, {"size", static_cast<std::int64_t>(size.value())}}, ""};
  }

  /// A device or a pipe.
  Result<std::uint64_t> deliverInto(const std::string &output, int from) {
    const UniqueFd to(::open(output.c_str(), O_WRONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
    if (!to) return posixError(errno, "opening " + output);
    return copy({from, to.get(), "the document", output}, "copying");
  }

  Result<std::uint64_t> deliverInPlaceOf(const std::string &output, int from, const FileClaim *claim) {
    auto replacement = Replacement::of(output);
    if (!replacement) return replacement.error();
    auto size = copy({from, replacement.value().descriptor(), "the document", output}, "copying");
    if (!size) return size;
    if (claim && claim->lost()) return claimLost(output + " stays as it was");
    if (auto failed = replacement.value().takePlace()) return *std::move(failed);
    return size;
  }

  const Invocation &invocation_;
  Client &client_;
  const Surroundings &surroundings_;
  const Deadline deadline_;
  /// Waits for the daemon; comes to its end with the coordinator at the latest.
  std::jthread ending_;
  FileCoordinator coordinator_;
  ProgressLine line_;
};

}  // namespace

bool movesContent(const VerbDescription &verb) { return verb.takes(Option::output) || verb.takes(Option::input); }

Result<Printed> moveContent(const Invocation &invocation, Client &client, const Surroundings &surroundings) {
  Transfer transfer(invocation, client, surroundings);
  switch (invocation.verb->verb) {
    case Verb::open:
      return transfer.open();
    case Verb::read:
      return transfer.read();
    case Verb::cat:
      return transfer.cat();
    default:
      return transfer.write();
  }
}

}  // namespace storix::ctl
