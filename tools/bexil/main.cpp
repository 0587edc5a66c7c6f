// bexil: the command line of the plug-in registry. One subcommand per request of bxd, plus the global exclusions
// preference. Every argument is checked before anything is sent; every wait for the daemon has a time limit.
// Exit status: 0 on success, the reply's error code on failure, 64 for bad arguments, 65 for a document on disk that
// cannot be used, 66 for an SDK that is not registered, 69 when bxd is not running, 70 for a reply the tool cannot
// read, 73 when the preferences file cannot be written, 75 when bxd did not answer in time, 78 when `doctor`
// found something wrong. `info` and `sdk` read the disk and never talk to bxd.

#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <atomic>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <filesystem>
#include <future>
#include <iostream>
#include <mutex>
#include <span>
#include <string>
#include <variant>
#include <vector>

#include "Completions.h"
#include "Doctor.h"
#include "PlugInInfo.h"
#include "Progress.h"
#include "ToolArguments.h"
#include "WatchView.h"
#include "base/Document.h"
#include "client/BXDaemonClient.h"
#include "client/BXDaemonClientSync.h"
#include "client/BXDaemonWatches.h"
#include "client/BXPlugInMatches.h"
#include "client/JsonText.h"
#include "model/BXBundle.h"
#include "platform/log/Log.h"
#include "platform/prefs/PreferencesStore.h"
#include "platform/zem/ZemListener.h"

namespace bexil::tool {
namespace {

namespace fs = std::filesystem;

struct Options {
    std::string service = BXDaemonClient::kDefaultServiceName;
    bool json = false;
    bool verbose = false;
    double timeoutSeconds = 30;
};

void usageError(const std::string& message) { std::fprintf(stderr, "bexil: %s\n", message.c_str()); }

int usageFailure(const Error& error) {
    usageError(error.localizedDescription().value_or("invalid arguments"));
    return kExitUsage;
}

// The exit status of a reply that reports a failure (said on standard error, and the reply printed with --json),
// or none when it reports success.
std::optional<int> failureStatus(const Options& options, const char* what, const Value& message) {
    std::optional<Error> error;
    try {
        error = BXDaemonClient::errorInReply(BXDaemonClient::Reply(message));
    } catch (const InternalInconsistency& inconsistency) {
        std::fprintf(stderr, "bexil: %s failed: %s\n", what, inconsistency.what());
        return kExitSoftware;
    }
    if (!error) return std::nullopt;
    if (options.json) std::printf("%s\n", toJson(message).c_str());
    std::fprintf(stderr, "bexil: %s failed (code %lld): %s\n", what, static_cast<long long>(error->code()),
                 error->localizedDescription().value_or("").c_str());
    if (const Value* conflicts = message.find(protocol::key::kConflicts); conflicts && !options.json)
        std::fprintf(stderr, "bexil: busy: %s\n", conflicts->description().c_str());
    return exitStatusForCode(error->code());
}

// The exit status, and the line on standard error, for a request that got a connection error in place of its reply:
// either the request could not be sent as it stands (the connection is fine: the user gave something that cannot
// travel, so it is a usage error), or bxd is not there.
int unsent(const Options& options, const char* what, const ZemError& error) {
    if (error.kind() == ZemError::Kind::MessageInvalid) {
        std::fprintf(stderr, "bexil: %s not sent: it holds text that is not UTF-8, nests too deep or is too large\n",
                     what);
        return kExitUsage;
    }
    std::fprintf(stderr, "bexil: bxd is not running on service %s (%s)\n", options.service.c_str(),
                 ZemListener::socketPathForService(options.service).c_str());
    return kExitUnavailable;
}

// Sends one request and turns the outcome into an exit status; on success `onSuccess` prints the reply.
// The time limit applies to the wait for the reply, or with `lastActivity` to each stretch without progress.
int roundTrip(const Options& options, const char* what,
              const std::function<void(BXDaemonClient&, BXDaemonClient::ReplyHandler)>& send,
              const std::function<int(BXDaemonClient&, const Value&)>& onSuccess,
              const std::function<std::chrono::steady_clock::time_point()>& lastActivity = nullptr) {
    BXDaemonClient client(options.service.c_str());
    auto timeout = std::chrono::milliseconds(static_cast<int64_t>(options.timeoutSeconds * 1000));
    std::optional<BXDaemonClient::Reply> reply = sendAndWait(
        [&](BXDaemonClient::ReplyHandler handler) { send(client, std::move(handler)); }, timeout, lastActivity);
    if (!reply) {
        std::fprintf(stderr, "bexil: bxd did not answer %s within %g seconds on service %s\n", what,
                     options.timeoutSeconds, options.service.c_str());
        return kExitTimeout;
    }
    if (const ZemError* error = std::get_if<ZemError>(&*reply)) return unsent(options, what, *error);
    const Value& message = std::get<Value>(*reply);
    if (std::optional<int> failed = failureStatus(options, what, message)) return *failed;
    if (options.json && !onSuccess) {
        std::printf("%s\n", toJson(message).c_str());
        return 0;
    }
    return onSuccess ? onSuccess(client, message) : 0;
}

std::string cell(const std::optional<std::string>& text) { return text && !text->empty() ? *text : "-"; }

int printMatches(const Options& options, BXDaemonClient& client, const Value& message) {
    if (options.json) {
        std::optional<Value> matches;
        if (const Value* encoded = message.find(protocol::key::kMatches)) matches = client.convertFromZEM(*encoded);
        std::printf("%s\n", toJson(matches.value_or(Value::emptyArray())).c_str());
        return 0;
    }
    auto plugIns = plugInsFromMatchReply(client, message);
    if (!plugIns) {
        std::fprintf(stderr, "bexil: match failed (code %lld): %s\n", static_cast<long long>(plugIns.error().code()),
                     plugIns.error().localizedDescription().value_or("").c_str());
        return kExitSoftware;
    }
    if (plugIns->empty()) {
        std::printf("no plug-ins match\n");
        return 0;
    }
    struct Row {
        std::string identifier, version, election, uuid, path;
    };
    std::vector<Row> rows{{"IDENTIFIER", "VERSION", "ELECTION", "UUID", "PATH"}};
    for (const auto& plugIn : *plugIns) {
        Row row;
        row.identifier = cell(plugIn->identifier());
        std::optional<Value> version = plugIn->version();
        row.version = version && version->isString() ? *version->getString() : "-";
        std::optional<Value> annotations = plugIn->annotations();
        std::optional<int64_t> election;
        if (annotations) election = annotations->get("election").numberAsInt64();
        row.election = election ? std::to_string(*election) : "-";
        row.uuid = plugIn->uuid() ? plugIn->uuid()->string() : "-";
        row.path = cell(plugIn->path());
        rows.push_back(std::move(row));
    }
    size_t w[4] = {0, 0, 0, 0};
    for (const Row& row : rows) {
        w[0] = std::max(w[0], row.identifier.size());
        w[1] = std::max(w[1], row.version.size());
        w[2] = std::max(w[2], row.election.size());
        w[3] = std::max(w[3], row.uuid.size());
    }
    for (const Row& row : rows) {
        std::printf("%-*s  %-*s  %-*s  %-*s  %s\n", static_cast<int>(w[0]), row.identifier.c_str(),
                    static_cast<int>(w[1]), row.version.c_str(), static_cast<int>(w[2]), row.election.c_str(),
                    static_cast<int>(w[3]), row.uuid.c_str(), row.path.c_str());
    }
    return 0;
}

int printHold(const Options& options, BXDaemonClient&, const Value& message) {
    if (options.json) {
        std::printf("%s\n", toJson(message).c_str());
        return 0;
    }
    const Value* uuid = message.find(protocol::key::kUuids);
    if (uuid == nullptr || !uuid->isUuid()) {
        std::fprintf(stderr, "bexil: hold granted without a hold UUID in the reply\n");
        return kExitSoftware;
    }
    std::printf("%s\n", uuid->getUuid()->string().c_str());
    return 0;
}

// Blocks until the tool is asked to stop (SIGINT, SIGTERM or SIGHUP); returns the signal.
int waitForStopSignal() {
    sigset_t stops;
    sigemptyset(&stops);
    for (int stop : {SIGINT, SIGTERM, SIGHUP}) sigaddset(&stops, stop);
    pthread_sigmask(SIG_BLOCK, &stops, nullptr);
    int received = 0;
    sigwait(&stops, &received);
    return received;
}

std::string ageText(double seconds) {
    long whole = seconds < 0 ? 0 : static_cast<long>(seconds);
    if (whole < 120) return std::to_string(whole) + "s";
    if (whole < 7200) return std::to_string(whole / 60) + "m";
    if (whole < 172800) return std::to_string(whole / 3600) + "h";
    return std::to_string(whole / 86400) + "d";
}

int printHolds(const Options& options, BXDaemonClient&, const Value& message) {
    const Value holds = message.get(protocol::key::kHolds);
    if (options.json) {
        std::printf("%s\n", toJson(holds).c_str());
        return 0;
    }
    if (holds.count() == 0) {
        std::printf("no holds\n");
        return 0;
    }
    const double now = Date::now().secondsSince1970;
    std::printf("%-36s  %7s  %5s  %-30s  %s\n", "HOLD", "PID", "AGE", "EXECUTABLE", "PLUG-INS");
    for (const Value& hold : holds.items()) {
        std::string plugIns;
        for (const Value& plugIn : hold.get("plugins").items())
            plugIns += (plugIns.empty() ? "" : ", ") + std::string(plugIn.get("identifier").stringView());
        std::optional<Date> created = hold.get("created").getDate();
        const Uuid* uuid = hold.get("uuid").getUuid();
        std::string executable(hold.get("executable").stringView());
        std::printf("%-36s  %7llu  %5s  %-30s  %s\n", uuid ? uuid->string().c_str() : "-",
                    static_cast<unsigned long long>(hold.get("pid").numberAsUInt64().value_or(0)),
                    created ? ageText(now - created->secondsSince1970).c_str() : "-",
                    executable.empty() ? "-" : executable.c_str(), plugIns.empty() ? "(none)" : plugIns.c_str());
    }
    return 0;
}

// One line per figure of a "status" reply, then the requests served by name (those served at least once).
int printStatus(const Options& options, BXDaemonClient&, const Value& message) {
    if (options.json) {
        std::printf("%s\n", toJson(message).c_str());
        return 0;
    }
    auto number = [&](std::string_view key) -> std::string {
        std::optional<uint64_t> value = message.get(key).numberAsUInt64();
        return value ? std::to_string(*value) : "unknown";
    };
    std::optional<uint64_t> uptime = message.get(protocol::key::kUptime).numberAsUInt64();
    std::printf("uptime:       %s\n", uptime ? ageText(static_cast<double>(*uptime)).c_str() : "unknown");
    std::printf("connections:  %s\n", number(protocol::key::kConnections).c_str());
    std::printf("registered:   %s plug-ins\n", number(protocol::key::kRegistered).c_str());
    std::printf("cache:        %s of %s records\n", number(protocol::key::kCachedRecords).c_str(),
                number(protocol::key::kCacheLimit).c_str());
    std::printf("holds:        %s\n", number(protocol::key::kHoldCount).c_str());
    std::printf("served:\n");
    for (const auto& [name, count] : message.get(protocol::key::kServed).entries())
        if (count.numberAsUInt64().value_or(0) > 0)
            std::printf("  %-14s %llu\n", name.c_str(),
                        static_cast<unsigned long long>(count.numberAsUInt64().value_or(0)));
    return 0;
}

int printExtensions(const Options& options, BXDaemonClient&, const Value& message) {
    if (options.json) {
        std::printf("%s\n", toJson(message).c_str());
        return 0;
    }
    // One token per line, as it is, so that a script can hand it on.
    for (const Value& token : message.get(protocol::key::kExtensions).items())
        std::printf("%s\n", token.isString() ? std::string(token.stringView()).c_str() : token.description().c_str());
    return 0;
}

// ---- exclusions ----

int exclusionsCommand(const Options& options, const std::string& setFile, const std::vector<std::string>& add,
                      bool clear) {
    PreferencesStore store;
    fs::path file = store.fileForDomain(kUserPrefsDomain);
    auto read = store.readDomain(kUserPrefsDomain);
    if (!read) {
        usageError("cannot read preferences " + file.string() + ": " +
                   read.error().localizedDescription().value_or(""));
        return kExitUsage;
    }
    Value preferences = *read;
    Value exclusions = preferences.get("exclusions");
    if (exclusions.isNull()) exclusions = Value::emptyArray();

    bool change = clear || !setFile.empty() || !add.empty();
    if (change) {
        MutableArray updated;
        if (!setFile.empty()) {
            auto value = readDictionaryFile(setFile);
            // A file given to --set holds {"exclusions": [...]}; a single rule dictionary is taken as one rule.
            if (!value) return usageFailure(value.error());
            Value rules = value->contains("exclusions") ? value->get("exclusions") : Value::array({*value});
            if (auto error = validateExclusions(rules)) return usageFailure(*error);
            updated = MutableArray(rules);
        } else if (!clear) {
            if (auto error = validateExclusions(exclusions)) return usageFailure(*error);
            updated = MutableArray(exclusions);
        }
        if (!add.empty()) {
            auto rule = rulesFromArguments(add);
            if (!rule) return usageFailure(rule.error());
            updated.append(*rule);
        }
        exclusions = updated.take();
        if (auto error = store.setValue(kUserPrefsDomain, "exclusions", exclusions)) {
            std::fprintf(stderr, "bexil: cannot write %s: %s\n", file.c_str(),
                         error->localizedDescription().value_or("").c_str());
            return 73;  // EX_CANTCREAT
        }
    }
    if (options.json) {
        std::printf("%s\n", toJson(exclusions).c_str());
    } else if (!change) {
        if (exclusions.count() == 0) std::printf("no exclusions (%s)\n", file.c_str());
        for (const Value& rule : exclusions.items()) std::printf("%s\n", toJson(rule, JsonLayout::OneLine).c_str());
    }
    return 0;
}

// ---- subcommands ----

// What the arguments of the subcommands fill in; each subcommand declares the fields it reads.
struct Arguments {
    std::vector<std::string> paths, uuids, rules, flagNames, addRules;
    std::string file, setFile;
    uint64_t flags = 0, generation = 0;
    int64_t election = -1;
    bool plugInPaths = false, refuseBusy = false, terminate = false, clear = false, wait = false;
    std::vector<std::string> say;
    std::string point;
    std::string plugIn;
};

using Printer = std::function<int(BXDaemonClient&, const Value&)>;

int withPaths(const Options& options, const Arguments& arguments, const char* what,
              void (BXDaemonClient::*send)(const Value&, BXDaemonClient::ReplyHandler)) {
    auto array = absolutePaths(arguments.paths);
    if (!array) return usageFailure(array.error());
    return roundTrip(options, what, [&](BXDaemonClient& c, auto h) { (c.*send)(*array, std::move(h)); }, {});
}

int withUuids(const Options& options, const Arguments& arguments, const char* what,
              const std::function<void(BXDaemonClient&, const std::vector<Uuid>&, BXDaemonClient::ReplyHandler)>& send,
              const Printer& done) {
    auto list = parseUuids(arguments.uuids);
    if (!list) return usageFailure(list.error());
    return roundTrip(
        options, what, [&](BXDaemonClient& c, auto h) { send(c, *list, std::move(h)); }, done);
}

int annotateWith(const Options& options, const Arguments& arguments, const Value& annotations) {
    return withUuids(options, arguments, "annotate",
                     [&](BXDaemonClient& c, const std::vector<Uuid>& list, auto h) {
                         c.setPluginAnnotationsAnnotationsReply(list, annotations, std::move(h));
                     },
                     {});
}

// Whether a reply reports success (a reply the tool cannot read counts as a failure).
bool succeeded(const BXDaemonClient::Reply& reply) {
    try {
        return std::holds_alternative<Value>(reply) && !BXDaemonClient::errorInReply(reply);
    } catch (const InternalInconsistency&) {
        return false;
    }
}

// Wraps a reply handler so that the progress line is gone before a failure is reported.
BXDaemonClient::ReplyHandler clearingOnFailure(Progress& progress, BXDaemonClient::ReplyHandler handler) {
    return [&progress, handler = std::move(handler)](const BXDaemonClient::Reply& reply) {
        if (!succeeded(reply)) progress.clear();
        handler(reply);
    };
}

// Paths per "add" request when many bundles are registered: each request is answered before the next goes out, so
// the progress line moves, and the first path that fails still stops the walk with the paths before it handled.
constexpr size_t kAddBatch = 64;

int addCommand(const Options& options, Arguments& arguments) {
    auto array = absolutePaths(arguments.paths);
    if (!array) return usageFailure(array.error());
    std::span<const Value> paths = array->items();
    if (paths.size() <= kAddBatch) return withPaths(options, arguments, "add", &BXDaemonClient::addPlugInsReply);
    Progress progress(!options.json);
    Value last = Value::emptyDictionary();
    for (size_t at = 0; at < paths.size(); at += kAddBatch) {
        progress.update("registering: " + std::to_string(at) + " of " + std::to_string(paths.size()) + " bundles");
        size_t end = std::min(paths.size(), at + kAddBatch);
        Value batch = Value::array(std::vector<Value>(paths.begin() + at, paths.begin() + end));
        int status = roundTrip(
            options, "add",
            [&](BXDaemonClient& c, auto h) { c.addPlugInsReply(batch, clearingOnFailure(progress, std::move(h))); },
            [&](BXDaemonClient&, const Value& message) {
                last = message;
                return 0;
            });
        if (status != 0) return status;
    }
    progress.clear();
    if (options.json) std::printf("%s\n", toJson(last).c_str());
    return 0;
}

int removeCommand(const Options& options, Arguments& arguments) {
    return withPaths(options, arguments, "remove", &BXDaemonClient::removePlugInsReply);
}

int bulkCommand(const Options& options, Arguments& arguments) {
    return roundTrip(options, "bulk", [&](BXDaemonClient& c, auto h) { c.bulkPluginsReply(arguments.flags, h); }, {});
}

// The rules of a discovery (match, explain, watch): the KEY=PATTERN arguments over those of --rules-file.
Result<Value> discoveryRules(const Arguments& arguments) {
    auto ruleSet = rulesFromArguments(arguments.rules);
    if (!ruleSet || arguments.file.empty()) return ruleSet;
    auto fromFile = readDictionaryFile(arguments.file);
    if (!fromFile) return fromFile;
    MutableDictionary merged(*fromFile);
    for (const DictionaryEntry& entry : ruleSet->entries()) merged.set(entry.key, entry.value);
    return merged.take();
}

int matchCommand(const Options& options, Arguments& arguments) {
    auto rules = discoveryRules(arguments);
    if (!rules) return usageFailure(rules.error());
    const Value& combined = *rules;
    auto matchFlags = discoveryFlags(arguments.flagNames);
    if (!matchFlags) return usageFailure(matchFlags.error());
    // Paged, so that any number of plug-ins fits: each page is one reply frame.
    Progress progress(!options.json);
    // --timeout bounds the wait for each page, not for the whole discovery.
    std::atomic<std::chrono::steady_clock::rep> lastPage{std::chrono::steady_clock::now().time_since_epoch().count()};
    auto pageDone = [&](size_t forms) {
        lastPage.store(std::chrono::steady_clock::now().time_since_epoch().count());
        progress.update("discovering: " + std::to_string(forms) + " plug-ins so far");
    };
    return roundTrip(
        options, "match",
        [&](BXDaemonClient& c, auto h) {
            c.matchAllPagesReply(combined, *matchFlags, protocol::page::kDefaultForms, pageDone,
                                 clearingOnFailure(progress, std::move(h)));
        },
        [&](BXDaemonClient& c, const Value& m) {
            progress.clear();
            return printMatches(options, c, m);
        },
        [&] { return std::chrono::steady_clock::time_point(std::chrono::steady_clock::duration(lastPage.load())); });
}

// The words after a step's mark in `bexil explain`: what the step found, from its details.
std::string stepDetail(const Value& step) {
    namespace explain = protocol::explain;
    const bool passed = step.get(explain::kPassed).getBool().value_or(false);
    const std::string_view name = step.get(explain::kStep).stringView();
    auto text = [&](std::string_view key) { return std::string(step.get(key).stringView()); };
    auto json = [](const Value& value) { return toJson(value, JsonLayout::OneLine); };
    std::string reason = text(explain::kReason);
    if (step.get(explain::kSkipped).getBool().value_or(false)) return "skipped: the flags discover all";
    if (name == explain::kRegistry) {
        std::string found = passed ? "found by the registry's query for these rules" : reason;
        if (!step.get(explain::kBundleOnDisk).getBool().value_or(true)) found += "; its bundle is missing on disk";
        return found;
    }
    if (name == explain::kResidence) {
        std::string where = step.get(explain::kSystemVolume).getBool().value_or(false) ? "on the system volume"
                            : step.contains(explain::kContainingApplication)
                                ? "inside " + text(explain::kContainingApplication)
                                : "outside every application";
        return passed ? where : where + ": " + reason;
    }
    if (name == explain::kDedication) {
        if (!step.get(explain::kDedicated).getBool().value_or(false)) return "not dedicated";
        return passed ? "dedicated to this application" : reason;
    }
    if (name == explain::kHold) {
        if (passed) return "not held";
        const Value& placer = step.get(explain::kPlacedBy);
        const Uuid* hold = step.get(explain::kHoldUuid).getUuid();
        return "held by " + (hold ? hold->string() : std::string("a hold")) + ", placed by pid " +
               std::to_string(placer.get(protocol::key::kPid).numberAsUInt64().value_or(0)) + " (" +
               std::string(placer.get(explain::kExecutable).stringView()) + ")";
    }
    if (name == explain::kRulesStep || name == explain::kExclusions) {
        std::string findings;
        for (const Value& finding : step.get(explain::kFindings).items()) {
            if (!findings.empty()) findings += "; ";
            findings += std::string(finding.get(explain::kKey).stringView()) + " " +
                        std::string(finding.get(explain::kOperator).stringView());
            if (finding.contains(explain::kOperand))
                findings += " " + json(finding.get(explain::kOperand));
            else if (!finding.get(explain::kPattern).isBool())
                findings += " " + json(finding.get(explain::kPattern));
            findings += ": value " + (finding.contains(explain::kValue) ? json(finding.get(explain::kValue)) : "none");
            findings += finding.get(explain::kPassed).getBool().value_or(false) ? ", holds" : ", fails";
        }
        if (name == explain::kRulesStep) return findings.empty() ? "no rules" : findings;
        if (passed)
            return "none of " + std::to_string(step.get(explain::kCount).numberAsUInt64().value_or(0)) + " matches";
        return "exclusion " + std::to_string(step.get(explain::kExclusion).numberAsUInt64().value_or(0)) + " " +
               json(step.get(explain::kExclusionRules)) + " matches: " + findings;
    }
    if (name == explain::kHostPolicy) return passed ? "allowed for this host" : reason;
    if (name == explain::kDuplicates) {
        if (!passed) return "lost to " + text(explain::kWinner) + " by " + text(explain::kTieBreak);
        return step.contains(explain::kReplacedBy) ? "kept; replaced by " + text(explain::kReplacedBy) : "kept";
    }
    return reason;
}

// One block per candidate: a heading with the plug-in and its outcome, then one line per step with its mark.
int printExplanation(const Options& options, const Value& plugIn, const Value& message) {
    namespace explain = protocol::explain;
    if (options.json) {
        std::printf("%s\n", toJson(message).c_str());
        return 0;
    }
    const Value& entries = message.get(protocol::key::kExplanation);
    if (entries.count() == 0) {
        std::printf("%s: %s\n", std::string(plugIn.stringView()).c_str(),
                    std::string(message.get(protocol::key::kNotFound).stringView()).c_str());
        return 0;
    }
    for (const Value& entry : entries.items()) {
        auto text = [&](std::string_view key) { return std::string(entry.get(key).stringView()); };
        std::printf("%s %s (%s): %s\n  %s\n", text(protocol::form::kIdentifier).c_str(),
                    text(protocol::form::kVersion).c_str(), text(protocol::form::kUuid).c_str(),
                    text(explain::kOutcome).c_str(), text(protocol::form::kPath).c_str());
        for (const Value& step : entry.get(explain::kSteps).items()) {
            bool passed = step.get(explain::kPassed).getBool().value_or(false);
            const char* mark = step.get(explain::kSkipped).getBool().value_or(false) ? "skip"
                               : passed                                              ? " ok "
                                                                                     : "FAIL";
            std::printf("  [%s] %-12s %s\n", mark, std::string(step.get(explain::kStep).stringView()).c_str(),
                        stepDetail(step).c_str());
        }
    }
    return 0;
}

int explainCommand(const Options& options, Arguments& arguments) {
    auto rules = discoveryRules(arguments);
    if (!rules) return usageFailure(rules.error());
    auto flags = discoveryFlags(arguments.flagNames);
    if (!flags) return usageFailure(flags.error());
    auto plugIn = plugInArgument(arguments.plugIn);
    if (!plugIn) return usageFailure(plugIn.error());
    return roundTrip(
        options, "explain",
        [&](BXDaemonClient& c, auto h) { c.explainPlugInRulesFlagsReply(*plugIn, *rules, *flags, std::move(h)); },
        [&](BXDaemonClient&, const Value& m) { return printExplanation(options, *plugIn, m); });
}

// Shows the result of a watch until interrupted (status 0) or until bxd goes away (69) or refuses (its code).
int watchCommand(const Options& options, Arguments& arguments) {
    auto rules = discoveryRules(arguments);
    if (!rules) return usageFailure(rules.error());
    auto watchFlags = discoveryFlags(arguments.flagNames);
    if (!watchFlags) return usageFailure(watchFlags.error());
    // Blocked before any thread starts, so that every thread inherits the mask and only sigtimedwait below takes
    // them: an interrupt ends the command cleanly.
    sigset_t stops;
    sigemptyset(&stops);
    for (int stop : {SIGINT, SIGTERM, SIGHUP}) sigaddset(&stops, stop);
    pthread_sigmask(SIG_BLOCK, &stops, nullptr);

    WatchView::Style style = options.json                   ? WatchView::Style::Json
                             : ::isatty(STDOUT_FILENO) == 1 ? WatchView::Style::Table
                                                            : WatchView::Style::Lines;
    WatchView view(style, stdout);
    struct Outcome {
        std::mutex mutex;
        std::optional<int> status;
        bool started = false;
    };
    auto outcome = std::make_shared<Outcome>();
    BXDaemonClient client(options.service.c_str());
    BXDaemonWatches watches(client);
    DaemonClient::WatchCallbacks callbacks;
    callbacks.result = [&view, outcome](const std::vector<Value>& forms, uint64_t generation) {
        {
            std::lock_guard lock(outcome->mutex);
            outcome->started = true;
        }
        view.result(forms, generation);
    };
    callbacks.change = [&view](const DaemonClient::WatchChange& change) { view.change(change); };
    callbacks.resync = [&view](uint64_t generation) { view.resync(generation); };
    callbacks.ended = [outcome](const Error& error) {
        std::lock_guard lock(outcome->mutex);
        if (outcome->status) return;
        std::string message = error.localizedDescription().value_or(error.description());
        std::fprintf(stderr, "bexil: watch: %s\n", message.c_str());
        outcome->status =
            message.starts_with(BXDaemonWatches::kConnectionLost) ? kExitUnavailable : exitStatusForCode(error.code());
    };
    watches.watch(*rules, *watchFlags, std::move(callbacks));

    const auto startDeadline = std::chrono::steady_clock::now() +
                               std::chrono::milliseconds(static_cast<int64_t>(options.timeoutSeconds * 1000));
    for (;;) {
        timespec tick{0, 100 * 1000 * 1000};
        int received = sigtimedwait(&stops, nullptr, &tick);
        if (received > 0) return 0;
        std::lock_guard lock(outcome->mutex);
        if (outcome->status) return *outcome->status;
        if (!outcome->started && std::chrono::steady_clock::now() > startDeadline) {
            std::fprintf(stderr, "bexil: bxd did not answer watch within %g seconds\n", options.timeoutSeconds);
            return kExitTimeout;
        }
    }
}

int readyCommand(const Options& options, Arguments& arguments) {
    return withUuids(options, arguments, "ready",
                     [](BXDaemonClient& c, const std::vector<Uuid>& l, auto h) { c.readyPlugInsFlagsReply(l, 0, h); },
                     {});
}

int accessCommand(const Options& options, Arguments& arguments) {
    return withUuids(
        options, arguments, "access",
        [](BXDaemonClient& c, const std::vector<Uuid>& l, auto h) { c.accessPlugInsFlagsReply(l, 0, h); },
        [&](BXDaemonClient& c, const Value& m) { return printExtensions(options, c, m); });
}

int annotateCommand(const Options& options, Arguments& arguments) {
    MutableDictionary annotations;
    if (arguments.election >= 0) annotations.set(protocol::annotation::kElection, Value::int64(arguments.election));
    if (!arguments.file.empty()) {
        auto extension = readDictionaryFile(arguments.file);
        if (!extension) return usageFailure(extension.error());
        annotations.set(protocol::annotation::kExtension, *extension);
    }
    if (annotations.count() == 0) {
        usageError("annotate needs --election or --extension");
        return kExitUsage;
    }
    return annotateWith(options, arguments, annotations.take());
}

int electCommand(const Options& options, Arguments& arguments) {
    return annotateWith(options, arguments,
                        Value::dictionary({{std::string(protocol::annotation::kElection), Value::int64(1)}}));
}

int unelectCommand(const Options& options, Arguments& arguments) {
    return annotateWith(options, arguments,
                        Value::dictionary({{std::string(protocol::annotation::kElection), Value::int64(0)}}));
}

int bulkAnnotateCommand(const Options& options, Arguments& arguments) {
    auto annotations = readDictionaryFile(arguments.file);
    if (!annotations) return usageFailure(annotations.error());
    for (const DictionaryEntry& entry : annotations->entries()) {
        if (!Uuid::parse(entry.key)) {
            usageError("bulk annotation key \"" + entry.key + "\" is not a plug-in UUID");
            return kExitUsage;
        }
        if (!entry.value.isDictionary()) {
            usageError("bulk annotation of " + entry.key + " is not a dictionary");
            return kExitUsage;
        }
    }
    return roundTrip(options, "bulk-annotate",
                     [&](BXDaemonClient& c, auto h) { c.bulkSetPluginAnnotationsReply(*annotations, h); }, {});
}

int holdCommand(const Options& options, Arguments& arguments) {
    auto array = absolutePaths(arguments.paths);
    if (!array) return usageFailure(array.error());
    uint64_t holdFlags = (arguments.plugInPaths ? protocol::hold::kPlugInPaths : 0) |
                         (arguments.refuseBusy ? protocol::hold::kRefuseBusy : 0) |
                         (arguments.terminate ? protocol::hold::kTerminate : 0);
    return roundTrip(
        options, "hold", [&](BXDaemonClient& c, auto h) { c.holdPluginsFlagsReply(*array, holdFlags, h); },
        [&](BXDaemonClient& c, const Value& m) {
            int status = printHold(options, c, m);
            if (status != 0 || !arguments.wait) return status;
            // The hold lives with this connection: keep it open until asked to stop.
            std::fflush(stdout);
            std::fprintf(stderr, "bexil: holding until interrupted\n");
            waitForStopSignal();
            std::fprintf(stderr, "bexil: releasing the hold\n");
            return 0;
        });
}

int holdsCommand(const Options& options, Arguments&) {
    return roundTrip(
        options, "holds", [](BXDaemonClient& c, auto h) { c.listHoldsReply(h); },
        [&](BXDaemonClient& c, const Value& m) { return printHolds(options, c, m); });
}

// One line per plug-in of a "changes" reply: what happened to it, its UUID, its identifier, the kinds of change (for
// a changed one) and the generation of its latest change; first the generation to follow on from.
int printChanges(const Options& options, BXDaemonClient&, const Value& message) {
    if (options.json) {
        std::printf("%s\n", toJson(message).c_str());
        return 0;
    }
    std::optional<uint64_t> current = message.get(protocol::key::kGeneration).numberAsUInt64();
    std::printf("generation %s\n", current ? std::to_string(*current).c_str() : "unknown");
    if (message.get(protocol::key::kResync).getBool().value_or(false))
        std::printf("resync: the global exclusions changed; any plug-in may have changed, match again\n");
    for (const Value& change : message.get(protocol::key::kChanges).items()) {
        const Uuid* uuid = change.get(protocol::change::kUuid).getUuid();
        std::string kinds;
        for (const Value& kind : change.get(protocol::change::kKinds).items())
            kinds += (kinds.empty() ? "" : ",") + std::string(kind.stringView());
        const std::string* identifier = change.get(protocol::change::kIdentifier).getString();
        std::printf(
            "%-8s %-36s %s%s%s @%llu\n", std::string(change.get(protocol::change::kEffect).stringView()).c_str(),
            uuid ? uuid->string().c_str() : "-", identifier ? identifier->c_str() : "-", kinds.empty() ? "" : " ",
            kinds.empty() ? "" : ("(" + kinds + ")").c_str(),
            static_cast<unsigned long long>(change.get(protocol::change::kGeneration).numberAsUInt64().value_or(0)));
    }
    return 0;
}

int changesCommand(const Options& options, Arguments& arguments) {
    return roundTrip(
        options, "changes", [&](BXDaemonClient& c, auto h) { c.changesReply(arguments.generation, h); },
        [&](BXDaemonClient& c, const Value& m) { return printChanges(options, c, m); });
}

int statusCommand(const Options& options, Arguments&) {
    return roundTrip(
        options, "status", [](BXDaemonClient& c, auto h) { c.statusReply(h); },
        [&](BXDaemonClient& c, const Value& m) { return printStatus(options, c, m); });
}

// Writes everything to `fd`; false when the other end is gone.
bool writeAll(int fd, std::string_view text) {
    while (!text.empty()) {
        ssize_t n = write(fd, text.data(), text.size());
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return false;
        text.remove_prefix(static_cast<size_t>(n));
    }
    return true;
}

// Reads one line (without its newline) from `fd`; none at the end of the stream.
std::optional<std::string> readLine(int fd) {
    std::string line;
    char c;
    for (;;) {
        ssize_t n = read(fd, &c, 1);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return line.empty() ? std::nullopt : std::optional<std::string>(line);
        if (c == '\n') return line;
        line += c;
    }
}

// Copies standard input to the plug-in and the plug-in's output to standard output until the plug-in ends.
void relay(int plugIn) {
    bool inputOpen = true;
    char buffer[4096];
    for (;;) {
        pollfd watched[2] = {{plugIn, POLLIN, 0}, {inputOpen ? 0 : -1, POLLIN, 0}};
        if (poll(watched, 2, -1) < 0) {
            if (errno == EINTR) continue;
            return;
        }
        if (watched[0].revents != 0) {
            ssize_t n = read(plugIn, buffer, sizeof buffer);
            if (n <= 0) return;
            if (!writeAll(1, std::string_view(buffer, static_cast<size_t>(n)))) return;
        }
        if (inputOpen && watched[1].revents != 0) {
            ssize_t n = read(0, buffer, sizeof buffer);
            if (n <= 0) {
                inputOpen = false;
                shutdown(plugIn, SHUT_WR);  // tells the plug-in that nothing more is coming
            } else if (!writeAll(plugIn, std::string_view(buffer, static_cast<size_t>(n)))) {
                return;
            }
        }
    }
}

// "identifier version" of the bundle a launch started, from its information dictionary.
std::string startedBundle(const Value& info) {
    std::string text(info.get("BDBundleIdentifier").stringView());
    for (const char* key : {"BDBundleShortVersionString", "BDBundleVersion"}) {
        if (const Value& version = info.get(key); version.isString()) {
            text += " " + std::string(version.stringView());
            break;
        }
    }
    return text.empty() ? "unnamed bundle" : text;
}

// Makes the plug-in ready for this process, launches it and talks to it: each --say line is sent and its answer
// printed, or without --say standard input is relayed to it and its output to standard output.
int launchCommand(const Options& options, Arguments& arguments) {
    auto list = parseUuids(arguments.uuids);
    if (!list) return usageFailure(list.error());
    // The grant belongs to this process, so ready and launch must both come from it.
    if (int status =
            roundTrip(options, "ready", [&](BXDaemonClient& c, auto h) { c.readyPlugInsFlagsReply(*list, 0, h); }, {});
        status != 0)
        return status;
    BXDaemonClient client(options.service.c_str());
    auto answer = std::make_shared<std::promise<std::variant<ZemMessage, ZemError>>>();
    client.launchPlugInReply(list->front(),
                             [answer](const std::variant<ZemMessage, ZemError>& reply) { answer->set_value(reply); });
    auto future = answer->get_future();
    if (future.wait_for(std::chrono::milliseconds(static_cast<int64_t>(options.timeoutSeconds * 1000))) !=
        std::future_status::ready) {
        std::fprintf(stderr, "bexil: bxd did not answer launch within %g seconds\n", options.timeoutSeconds);
        return kExitTimeout;
    }
    std::variant<ZemMessage, ZemError> reply = future.get();
    if (const ZemError* error = std::get_if<ZemError>(&reply)) return unsent(options, "launch", *error);
    const ZemMessage& message = std::get<ZemMessage>(reply);
    if (std::optional<int> failed = failureStatus(options, "launch", message.body())) return *failed;
    if (message.descriptorCount() != 1) {
        std::fprintf(stderr, "bexil: launch answered without a socket to the plug-in\n");
        return kExitSoftware;
    }
    const int plugIn = message.descriptor(0);
    const uint64_t pid = message.body().get(protocol::key::kPid).numberAsUInt64().value_or(0);
    if (options.json)
        std::printf("%s\n", toJson(message.body()).c_str());
    else
        std::fprintf(stderr, "bexil: plug-in instance %llu started (%s)\n", static_cast<unsigned long long>(pid),
                     startedBundle(message.body().get(protocol::key::kBundleInfo)).c_str());
    std::fflush(stdout);
    if (arguments.say.empty()) {
        relay(plugIn);
        std::fprintf(stderr, "bexil: plug-in instance %llu ended\n", static_cast<unsigned long long>(pid));
        return 0;
    }
    for (const std::string& line : arguments.say) {
        if (!writeAll(plugIn, line + "\n")) break;
        std::optional<std::string> heard = readLine(plugIn);
        if (!heard) {
            std::fprintf(stderr, "bexil: the plug-in ended without answering\n");
            return kExitSoftware;
        }
        std::printf("%s\n", heard->c_str());
    }
    return 0;
}

int releaseCommand(const Options& options, Arguments& arguments) {
    return withUuids(options, arguments, "release",
                     [](BXDaemonClient& c, const std::vector<Uuid>& l, auto h) { c.releaseHoldReply(l.front(), h); },
                     {});
}

int exclusionsSubcommand(const Options& options, Arguments& arguments) {
    return exclusionsCommand(options, arguments.setFile, arguments.addRules, arguments.clear);
}

// ---- plug-in bundles and SDKs on disk ----

// Prints the SDK dictionary registered for an extension point, with the document it came from.
int sdkShowCommand(const Options& options, Arguments& arguments) {
    auto sdk = findSDK(arguments.point);
    if (!sdk) {
        std::fprintf(stderr, "bexil: the SDK of %s cannot be used: %s\n", arguments.point.c_str(),
                     sdk.error().localizedDescription().value_or("").c_str());
        return kExitDataError;
    }
    if (!*sdk) {
        std::fprintf(stderr, "bexil: no SDK is registered for extension point %s (searched %s)\n",
                     arguments.point.c_str(), sdkDirectoriesText().c_str());
        return kExitNoInput;
    }
    if (options.json) {
        std::printf("%s\n", toJson((*sdk)->dictionary).c_str());
        return 0;
    }
    std::printf("SDK of %s from %s:\n%s\n", arguments.point.c_str(), (*sdk)->path.c_str(),
                toJson((*sdk)->dictionary).c_str());
    return 0;
}

// Shows a plug-in bundle as a client sees it: its information dictionary with the SDK of its extension point merged
// under it and its plug-in dictionary canonicalized, so that its author sees what the extension point gave it.
int infoCommand(const Options& options, Arguments& arguments) {
    auto record = resolvedPlugInAtPath(arguments.file);
    if (!record) {
        usageError(record.error().localizedDescription().value_or("cannot read the plug-in"));
        return kExitDataError;
    }
    const Value plugIn = (*record)->plugInDictionary().value_or(Value::emptyDictionary());
    MutableDictionary resolved((*record)->bundleInfoDictionary().value_or(Value::emptyDictionary()));
    resolved.set("RZExtension", plugIn);
    if (options.json) {
        std::printf("%s\n", toJson(resolved.take()).c_str());
        return 0;
    }
    std::optional<Value> point = (*record)->sdkSpec();
    std::string sdkLine = !point ? "none named" : "none: the extension point's name is not a string";
    std::vector<std::string> added;
    if (point && point->isString()) {
        auto sdk = findSDK(point->stringView());
        if (!sdk) {
            sdkLine = "cannot be used: " + sdk.error().localizedDescription().value_or("");
        } else if (!*sdk) {
            sdkLine = "not registered";
        } else {
            sdkLine = (*sdk)->path.string();
            std::optional<Value> own = BXBundle::initWithPath(*(*record)->path())->infoDictionary();
            added =
                keysAddedBySDK(own ? own->get("RZExtension") : Value::emptyDictionary(), plugIn, (*sdk)->dictionary);
        }
    }
    std::string addedText;
    for (const std::string& key : added) addedText += (addedText.empty() ? "" : ", ") + key;
    std::optional<Value> version = (*record)->version();
    std::printf("identifier:      %s\n", cell((*record)->identifier()).c_str());
    std::printf("path:            %s\n", cell((*record)->path()).c_str());
    std::printf("version:         %s\n", version && version->isString() ? version->getString()->c_str() : "-");
    std::string pointText = !point ? "-" : point->isString() ? std::string(point->stringView()) : point->description();
    std::printf("extension point: %s\n", pointText.c_str());
    std::printf("SDK:             %s\n", sdkLine.c_str());
    std::printf("from the SDK:    %s\n", addedText.empty() ? "-" : addedText.c_str());
    std::printf("RZExtension after SDK resolution:\n%s\n", toJson(plugIn).c_str());
    return 0;
}

// Checks the installation this command would talk to; prints one line per check and fails when any check does.
int doctorCommand(const Options& options, Arguments&) {
    std::vector<DoctorCheck> checks =
        runDoctor(options.service, std::chrono::milliseconds(static_cast<int64_t>(options.timeoutSeconds * 1000)));
    bool allOk = true;
    for (const DoctorCheck& check : checks) allOk = allOk && check.ok;
    if (options.json) {
        std::printf("%s\n", toJson(doctorValue(checks)).c_str());
    } else {
        for (const DoctorCheck& check : checks) std::printf("%s\n", doctorLine(check).c_str());
    }
    return allOk ? 0 : kExitConfig;
}

void pathsArgument(CLI::App& command, Arguments& arguments) {
    command.add_option("paths", arguments.paths, "absolute paths of plug-in bundles")->required();
}
// The rules and flags of a discovery, shared by match, explain and watch (see discoveryRules).
void discoveryArguments(CLI::App& c, Arguments& a) {
    c.add_option("rules", a.rules, "rules as KEY=PATTERN");
    c.add_option("--rules-file", a.file, "rule dictionary from a .vrec or JSON file");
    c.add_option("--flag", a.flagNames, "all-versions, all-instances, system-only or all (repeatable)");
}

void uuidsArgument(CLI::App& command, Arguments& arguments) {
    command.add_option("uuids", arguments.uuids, "plug-in UUIDs")->required();
}

// One subcommand: its name, its help (one line, then an example), the arguments it declares and what it does.
struct Subcommand {
    const char* name;
    const char* help;
    void (*declare)(CLI::App& command, Arguments& arguments);
    int (*action)(const Options& options, Arguments& arguments);
};

// In the order the help lists them.
const Subcommand kSubcommands[] = {
    {"add", "register plug-in bundles\n  example: bexil add /opt/Greeter.app/PlugIns/Hello.bxplugin", pathsArgument,
     addCommand},
    {"remove",
     "unregister plug-in bundles (needs the manager entitlement)\n  example: bexil remove "
     "/opt/Greeter.app/PlugIns/Hello.bxplugin",
     pathsArgument, removeCommand},
    {"bulk", "bulk registration request (no option is supported today)\n  example: bexil bulk",
     [](CLI::App& c, Arguments& a) { c.add_option("--flags", a.flags, "option bits"); }, bulkCommand},
    {"match",
     "discover plug-ins\n  example: bexil match RZExtensionPointIdentifier=com.example.greeting --flag all-versions",
     discoveryArguments, matchCommand},
    {"explain",
     "say step by step why match with these rules finds a plug-in or not\n  example: bexil explain "
     "RZExtensionPointIdentifier=com.example.greeting --plugin com.example.greeter.hello",
     [](CLI::App& c, Arguments& a) {
         discoveryArguments(c, a);
         c.add_option("--plugin", a.plugIn, "the plug-in: its identifier, UUID or bundle path")->required();
     },
     explainCommand},
    {"watch",
     "show the plug-ins that match rules and every change of them until interrupted (a table on a terminal, one "
     "line per change otherwise)\n  example: bexil watch RZExtensionPointIdentifier=com.example.greeting",
     discoveryArguments, watchCommand},
    {"ready", "make plug-ins ready for this host\n  example: bexil ready 2F1C...-...", uuidsArgument, readyCommand},
    {"launch",
     "make a plug-in ready for this command and start it in its sandbox, then talk to it\n  example: bexil launch "
     "2F1C... --say world",
     [](CLI::App& c, Arguments& a) {
         c.add_option("uuid", a.uuids, "the plug-in's UUID")->required()->expected(1);
         c.add_option("--say", a.say, "send this line and print the answer (repeatable); else relay standard input");
     },
     launchCommand},
    {"access", "get read access tokens for plug-in bundles\n  example: bexil access 2F1C...", uuidsArgument,
     accessCommand},
    {"annotate", "set annotations of plug-ins\n  example: bexil annotate --election 1 --extension ext.json 2F1C...",
     [](CLI::App& c, Arguments& a) {
         uuidsArgument(c, a);
         c.add_option("--election", a.election, "election value (0: none, 1: elected)")->check(CLI::NonNegativeNumber);
         c.add_option("--extension", a.file, "the client-defined annotation from a .vrec or JSON file");
     },
     annotateCommand},
    {"elect", "elect plug-ins (election 1)\n  example: bexil elect 2F1C...", uuidsArgument, electCommand},
    {"unelect", "withdraw the election of plug-ins (election 0)\n  example: bexil unelect 2F1C...", uuidsArgument,
     unelectCommand},
    {"bulk-annotate",
     "replace the client-defined annotations of many plug-ins\n  example: bexil bulk-annotate annotations.json   # "
     "{\"<uuid>\": {...}, ...}",
     [](CLI::App& c, Arguments& a) {
         c.add_option("file", a.file, ".vrec or JSON dictionary from plug-in UUID to annotation")->required();
     },
     bulkAnnotateCommand},
    {"hold", "hold plug-ins out of use; prints the hold UUID\n  example: bexil hold --refuse-busy /opt/Greeter.app",
     [](CLI::App& c, Arguments& a) {
         c.add_option("paths", a.paths, "absolute paths of applications (or plug-ins with --plugin-paths)")->required();
         c.add_flag("--plugin-paths", a.plugInPaths, "the paths name plug-in bundles, not applications");
         c.add_flag("--refuse-busy", a.refuseBusy, "refuse the hold when a plug-in is busy");
         c.add_flag("--terminate", a.terminate, "terminate running instances once the hold is placed");
         c.add_flag("--wait", a.wait, "keep the hold until interrupted (it ends with this command)");
     },
     holdCommand},
    {"holds", "list the holds in force (needs the manager entitlement)\n  example: bexil holds",
     [](CLI::App&, Arguments&) {}, holdsCommand},
    {"release", "release a hold\n  example: bexil release 7A0E...",
     [](CLI::App& c, Arguments& a) { c.add_option("uuid", a.uuids, "the hold's UUID")->required()->expected(1); },
     releaseCommand},
    {"exclusions",
     "show or set the global exclusions preference\n  example: bexil exclusions --add "
     "RZExtensionPointIdentifier=com.example.ads",
     [](CLI::App& c, Arguments& a) {
         c.add_option("--set", a.setFile, "replace the exclusions by a .vrec or JSON file");
         c.add_option("--add", a.addRules, "append one rule made of KEY=PATTERN arguments");
         c.add_flag("--clear", a.clear, "remove every exclusion");
     },
     exclusionsSubcommand},
    {"status",
     "what bxd is doing now: uptime, connections, plug-ins, cache, holds, requests served\n  example: bexil status",
     [](CLI::App&, Arguments&) {}, statusCommand},
    {"changes",
     "what changed since a generation (from a match or changes reply): plug-ins added, removed, changed\n  example: "
     "bexil changes 1764090000000001",
     [](CLI::App& c, Arguments& a) {
         c.add_option("generation", a.generation, "the generation to answer from")->required();
     },
     changesCommand},
    {"doctor",
     "check this installation (daemon, directories, entitlements, bubblewrap, MIME database, journal) and say what to "
     "fix\n  example: bexil doctor",
     [](CLI::App&, Arguments&) {}, doctorCommand},
    {"info",
     "show a plug-in bundle on disk after SDK resolution: what its extension point gives it\n  example: bexil info "
     "/opt/Greeter.app/PlugIns/Hello.bxplugin",
     [](CLI::App& c, Arguments& a) { c.add_option("path", a.file, "the plug-in bundle's directory")->required(); },
     infoCommand},
    {"sdk", "show the SDK dictionary registered for an extension point\n  example: bexil sdk show com.example.greeting",
     [](CLI::App& c, Arguments& a) {
         c.require_subcommand(1);
         c.add_subcommand("show", "print the SDK dictionary of an extension point")
             ->add_option("point", a.point, "the extension point's name")
             ->required();
     },
     sdkShowCommand},
};

int run(int argc, char** argv) {
    Options options;
    CLI::App app{
        "bexil: talk to bxd, the plug-in registry daemon.\n"
        "Exit status: 0 on success; the daemon's error code when a request fails (2 unknown plug-in, 4 malformed\n"
        "request, 7 version mismatch, 9 bad path, 11 not allowed, 12 invalid plug-in, 14 busy, 18 bad bulk\n"
        "annotation, 19 paged discovery must start again, 20 generation too old: match again, 21 too many\n"
        "watches); 64 bad arguments (nothing sent); 65 unusable SDK or Info.vrec; 66 SDK not registered;\n"
        "69 bxd not running or gone; 70 unreadable reply; 73 preferences not writable; 75 no answer in time;\n"
        "78 doctor found a problem.",
        "bexil"};
    app.require_subcommand(1);
    app.add_option("--service", options.service, "Zem service name of bxd")->capture_default_str();
    app.add_flag("--json", options.json, "print replies as JSON for scripts");
    app.add_flag("-v,--verbose", options.verbose, "log the request and reply trace to standard error");
    app.add_option("--timeout", options.timeoutSeconds, "seconds to wait for a reply")
        ->check(CLI::PositiveNumber)
        ->capture_default_str();

    Arguments arguments;
    std::vector<std::pair<CLI::App*, const Subcommand*>> commands;
    for (const Subcommand& subcommand : kSubcommands) {
        CLI::App* command = app.add_subcommand(subcommand.name, subcommand.help);
        subcommand.declare(*command, arguments);
        commands.emplace_back(command, &subcommand);
    }

    // Written from `app` itself, so it knows every subcommand and option declared above (itself included).
    std::string shell;
    CLI::App* completions =
        app.add_subcommand("completions",
                           "print the completion script for a shell\n  example: bexil completions bash "
                           ">~/.local/share/bash-completion/completions/bexil");
    completions->add_option("shell", shell, "bash, zsh or fish")
        ->required()
        ->check(CLI::IsMember(std::vector<std::string>(std::begin(kCompletionShells), std::end(kCompletionShells))));

    try {
        app.parse(argc, argv);
    } catch (const CLI::CallForHelp& e) {
        return app.exit(e);
    } catch (const CLI::CallForAllHelp& e) {
        return app.exit(e);
    } catch (const CLI::ParseError& e) {
        std::fprintf(stderr, "bexil: %s\n", e.what());
        return kExitUsage;
    }

    // The library logs to the system log; on a terminal without one, its lines would mix with the tool's own.
    log::LogRegistry::shared().setThreshold(options.verbose ? log::Level::Debug : log::Level::Fault);

    if (*completions) {
        std::fputs(completionScript(app, shell).value_or("").c_str(), stdout);
        return 0;
    }
    for (const auto& [command, subcommand] : commands)
        if (*command) return subcommand->action(options, arguments);
    return kExitUsage;
}

}  // namespace
}  // namespace bexil::tool

int main(int argc, char** argv) { return bexil::tool::run(argc, argv); }
