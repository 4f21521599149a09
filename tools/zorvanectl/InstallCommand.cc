// SPDX-License-Identifier: Apache-2.0
// An archive or a directory becomes the content of a container: a transient container is made, filled, and put in the
// place of the live one with one replace.
//
// Until that replace the live container is not touched, and the replace puts it away only when the new one takes its
// place. So whatever fails (a signal, a full disk, a broken archive, a daemon that went away), the old one stays as it
// was. The transient one is deleted then. If that cannot be, after a kill of this program or with the daemon gone,
// it lies there until it is asked for again, which the next installation does, until somebody deletes the identifier's
// transient container (zorvanectl delete --transient), or until the first launch after a boot sweeps it.
//
// Nobody is deleted on a guess: when a replace fails or its answer is lost, the daemon is asked what is live now, and
// where it does not say, nothing is thrown away.
#include "Commands.h"
#include "KnownContainer.h"
#include "LostRecord.h"
#include "ProgressDisplay.h"
#include "content/ContainerDirectory.h"
#include "content/Content.h"
#include "os/LinuxDisk.h"

#include <algorithm>
#include <csignal>
#include <initializer_list>

namespace zorvanectl {

using zorvane::Client;

namespace {

volatile std::sig_atomic_t receivedSignal = 0;

void keepSignal(int signal) {
    receivedSignal = signal;
}

/// From here on a signal is kept, and the program decides when to end. The same one again ends it where it is: it may
/// be waiting for a daemon that does not answer.
void keepSignals() {
    struct sigaction keep{};
    keep.sa_handler = keepSignal;
    keep.sa_flags = static_cast<int>(SA_RESETHAND); // and not SA_RESTART: a read that waits is to end
    for (const int signal : {SIGINT, SIGTERM, SIGHUP}) {
        struct sigaction before{};
        // Signals that were ignored when this program began, as under nohup, stay so.
        if (::sigaction(signal, nullptr, &before) == 0 && before.sa_handler != SIG_IGN)
            ::sigaction(signal, &keep, nullptr);
    }
    std::signal(SIGPIPE, SIG_IGN); // who reads the progress may go; the installation goes on
}

/// Ends as the signal would have ended it, once everything is in order.
void endBySignal() {
    if (const int signal = receivedSignal; signal != 0) {
        std::signal(signal, SIG_DFL);
        ::raise(signal);
    }
}

bool canBeInstalled(std::uint64_t containerClass) {
    const std::string_view name = zorvane::containerClassName(containerClass);
    return name.starts_with("Bundle/") || (name.starts_with("Data/") && name != "Data/System");
}

class Installation {
public:
    Installation(const zorvane::ConnectOptions& connect, const Output& output, const Target& target,
                 const InstallOptions& options)
        : connect_(connect), output_(output), target_(target), options_(options),
          what_("install " + options.source + " as " + target.identifier + " in " +
                std::string(zorvane::containerClassName(target.containerClass))) {}

    int run(Consent consent);

private:
    int install(Client& client);
    int replace(Client& client);
    int settle(const zorvane::Error& error);
    int done(Client& client);
    /// `advice`: what to do, where it is not to try again.
    int failed(const std::string& message, const char* advice = "");
    /// The fate of the transient container, for the end of a message.
    std::string discard();

    const zorvane::ConnectOptions& connect_;
    const Output& output_;
    const Target& target_;
    const InstallOptions& options_;
    const std::string what_;
    content::Source source_;
    std::optional<Client::Address> old_;
    LostRecord lost_;
    Client::Address fresh_;
    std::string freshPath_;
    std::optional<std::uint64_t> bytesOut_ = 0;
    std::optional<std::uint64_t> bytesIn_ = 0;
    std::uint64_t items_ = 0;
    bool isDone_ = false;
};

int Installation::run(Consent consent) {
    if (!canBeInstalled(target_.containerClass))
        return output_.localError(exitUsage, "only bundle and data containers get their content this way",
                                  "name another class", what_);
    const bool fromInput = options_.source == "-";
    auto source = fromInput ? content::Source::ofStandardInput() : content::Source::open(options_.source);
    if (!source)
        return output_.localError(exitUsage, source.error().what,
                                  fromInput
                                      ? "have another program write an archive there, or name one"
                                      : "name an archive or a directory that its own owner, or root, has put there",
                                  what_);
    source_ = std::move(*source);
    auto client = Client::connect(connect_);
    if (!client)
        return output_.error(client.error(), what_);
    const auto old = find(*client, target_, false);
    if (!old && old.error().code != codeNotFound)
        return output_.error(old.error(), what_);
    if (old) {
        old_ = *old;
        lost_ = lostRecordOf(*client, *old_);
        if (const auto refused = refuseToLoseClass(connect_, output_, lost_, options_.keepClass, what_))
            return *refused;
        bytesOut_ = measured(connect_, {&*old_, 1});
        if (consent == Consent::ask &&
            !output_.agreed(lossQuestion("Replace", bytesOut_, target_.identifier, lostInfoText(lost_)), what_))
            return exitUsage;
    }
    const int exitCode = install(*client);
    if (!isDone_) // what is done is not told as interrupted
        endBySignal();
    return exitCode;
}

int Installation::install(Client& client) {
    keepSignals(); // before the first change, so that whatever was begun is put in order
    const auto made = client.createOrLookup({.containerClass = target_.containerClass,
                                             .user = userOf(target_),
                                             .identifier = target_.identifier,
                                             .create = true,
                                             .transient = true});
    if (!made)
        return output_.error(made.error(), what_);
    freshPath_ = made->path;
    fresh_ = {.containerClass = target_.containerClass,
              .user = userOf(target_),
              .identifier = target_.identifier,
              .uuid = made->uuid};
    zor::platform::LinuxDisk disk;
    const auto container = content::openNewContainer(disk, freshPath_, fenceKind(target_.containerClass));
    if (!container)
        return failed(container.error().what);
    {
        ProgressDisplay display(options_.progress);
        const content::Observer observer{.progressed =
                                             [&](content::Phase phase, const content::Progress& progress) {
                                                 display.show(
                                                     {.phase = phase == content::Phase::copying ? "copying" : "syncing",
                                                      .items = progress.items,
                                                      .bytes = progress.bytes,
                                                      .share = progress.share});
                                             },
                                         .wantsShare = display.isShown()};
        const auto filled = content::putContent(disk, container->get(), source_, observer, receivedSignal);
        if (!filled)
            return failed(filled.error().what, filled.error().advice);
        items_ = filled->items;
    }
    // The daemon may have been started anew meanwhile.
    auto again = Client::connect(connect_);
    if (!again)
        return failed(again.error().message);
    return replace(*again);
}

int Installation::replace(Client& client) {
    // Standard subdirectories that the content took the place of get their owner and mode again, or come back.
    if (const auto repaired = client.recreateDefaultStructure(fresh_); !repaired)
        return failed(repaired.error().message);
    bytesIn_ = measured(connect_, {&fresh_, 1});
    if (receivedSignal != 0)
        return failed("it was interrupted");
    if (const auto replaced = client.replace(old_, fresh_); !replaced)
        return settle(replaced.error());
    return done(client);
}

/// The replace failed, or its answer did not come.
int Installation::settle(const zorvane::Error& error) {
    auto client = Client::connect(connect_);
    const auto live = client ? client->list(target_.containerClass, userOf(target_), false)
                             : zorvane::Result<std::vector<zorvane::ListedContainer>>(std::unexpected(client.error()));
    if (!live) // the new one may be the only one left
        return output_.localError(exitLocalError,
                                  error.message + ". Which container is live cannot be told: " + live.error().message +
                                      ". The new content was put together in " + printable(freshPath_) +
                                      ", and is not thrown away",
                                  "see with 'zorvanectl list' whether there is a container; if there is none, "
                                  "'zorvanectl replace' puts the new one in place until the next boot",
                                  what_);
    const auto isLive = [&](const std::array<std::uint8_t, 16>& uuid) {
        return std::ranges::find(*live, uuid, &zorvane::ListedContainer::uuid) != live->end();
    };
    if (isLive(fresh_.uuid))
        return done(*client);
    if (!old_ || isLive(old_->uuid))
        return failed(error.message);
    return output_.localError(exitLocalError,
                              error.message +
                                  ". The old container is not there any more; the new content waits, whole, in " +
                                  printable(freshPath_),
                              "'zorvanectl replace' puts it in place until the next boot", what_);
}

int Installation::done(Client& client) {
    isDone_ = true;
    const auto metadata = client.metadata(fresh_);
    const std::string path = metadata ? metadata->path : "";
    const bool kept = setClassAgain(client, output_, target_, lost_);
    const int exitCode = kept || options_.keepClass == KeepClass::ifPossible ? exitDone : exitLocalError;
    if (output_.isJson()) {
        nlohmann::json json = {{"identifier", target_.identifier},
                               {"class", target_.containerClass},
                               {"uuid", zorvane::uuidText(fresh_.uuid)},
                               {"path", path},
                               {"items", items_},
                               {"bytesIn", toJson(bytesIn_)},
                               {"replaced", old_.has_value()}};
        json["bytesOut"] = toJson(bytesOut_);
        addLost(json, lost_, kept);
        output_.json(std::move(json));
        return exitCode;
    }
    output_.line(printable(target_.identifier) + " installed: " + shownBytes(bytesIn_) + " in " +
                 std::to_string(items_) + (items_ == 1 ? " item" : " items") + " came" +
                 (old_ ? ", " + shownBytes(bytesOut_) + " went" : "") +
                 (lost_.infoKeys.empty() ? "" : ", and " + lostInfoText(lost_)));
    output_.line("  path  " + printable(path));
    return exitCode;
}

int Installation::failed(const std::string& message, const char* advice) {
    return output_.localError(exitLocalError, message + ". " + discard(),
                              (old_ ? "the old container is as it was; " : "") +
                                  std::string(*advice == '\0' ? "try again when the cause is gone" : advice),
                              what_);
}

std::string Installation::discard() {
    std::string left = "The new container stays in " + printable(freshPath_) + " until the next boot";
    auto client = Client::connect(connect_);
    if (!client)
        return left;
    const auto transient = find(*client, target_, true);
    if (!transient)
        return transient.error().code == codeNotFound ? "The new container is gone" : left;
    if (transient->uuid != fresh_.uuid)
        return "The new container made room for somebody else's";
    // By its being transient: it can never take one with it that has become live.
    const auto deleted = client->deleteContainer(target_.containerClass, userOf(target_), target_.identifier, true);
    return deleted || deleted.error().code == codeNotFound ? "The new container was thrown away" : left;
}

} // namespace

int install(const zorvane::ConnectOptions& connect, const Output& output, const Target& target,
            const InstallOptions& options, Consent consent) {
    return Installation(connect, output, target, options).run(consent);
}

} // namespace zorvanectl
