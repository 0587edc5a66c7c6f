// docs/protocol.md is the contract a client in another language is written against, and bexil/Protocol.h is the
// one definition the daemon, the library and the tool are built from. These tests hold the two together: every
// request, key, flag bit, error code and name of the definition is in the document, and every request and error
// code the document's tables list is in the definition.

#include <gtest/gtest.h>

#include <set>
#include <sstream>
#include <string>

#include "ProtocolDocument.h"
#include "bexil/Protocol.h"

namespace bexil {
namespace {

using namespace protocol;

// The first cells of the table rows under the heading `heading`, up to the next heading.
std::vector<std::string> firstCells(const std::string& document, const std::string& heading) {
    std::istringstream in(document);
    std::string line;
    std::vector<std::string> cells;
    bool inside = false;
    while (std::getline(in, line)) {
        if (line.starts_with("#")) {
            inside = line == heading;
            continue;
        }
        if (!inside || !line.starts_with("| ") || line.starts_with("|---")) continue;
        std::string cell = line.substr(2, line.find(" |", 2) - 2);
        cells.push_back(cell);
    }
    return cells;
}

std::string quoted(std::string_view text) { return "\"" + std::string(text) + "\""; }

std::string hexBit(uint64_t bit) {
    std::ostringstream out;
    out << "| 0x" << std::hex << bit << " |";
    return out.str();
}

class ProtocolDocument : public testing::Test {
  protected:
    std::string document_ = test::protocolDocument();
};

TEST_F(ProtocolDocument, ListsExactlyTheDefinedRequests) {
    ASSERT_FALSE(document_.empty()) << "docs/protocol.md not found";
    std::set<std::string> documented;
    for (const std::string& cell : firstCells(document_, "### Requests"))
        if (cell.starts_with("\"")) documented.insert(cell);
    std::set<std::string> defined;
    for (const RequestInfo& info : kRequests) {
        defined.insert(quoted(info.name));
        EXPECT_EQ(requestNamed(info.name), info.request) << info.name;
        EXPECT_EQ(nameOf(info.request), info.name);
    }
    EXPECT_EQ(documented, defined);
    EXPECT_FALSE(requestNamed("Add")) << "names are compared byte for byte";
}

TEST_F(ProtocolDocument, ListsExactlyTheDefinedErrorCodes) {
    std::set<int> documented;
    for (const std::string& cell : firstCells(document_, "### Error codes"))
        if (!cell.empty() && std::isdigit(static_cast<unsigned char>(cell[0]))) documented.insert(std::stoi(cell));
    std::set<int> defined;
    for (ErrorCode code : kErrorCodes) defined.insert(codeOf(code));
    EXPECT_EQ(documented, defined);
    EXPECT_EQ(defined.size(), kErrorCodes.size()) << "a code listed twice";
    // The document names each code as the header does, so a reader can go from one to the other.
    for (const char* name : {"`RegistryRefused`", "`InvalidRequest`, `OperationFailed`", "`BadInterfaceSpec`",
                             "`VersionMismatch`", "`BadPath`", "`NotAllowed`", "`InvalidConfiguration`",
                             "`PlugInsBusy`", "`BadBulkAnnotation`", "`BadContinuation`", "`GenerationTooOld`"})
        EXPECT_NE(document_.find(name), std::string::npos) << name;
}

TEST_F(ProtocolDocument, DescribesEveryKeyFlagAndName) {
    for (auto keys :
         {std::vector<std::string_view>(key::kList.begin(), key::kList.end()),
          std::vector<std::string_view>(form::kList.begin(), form::kList.end()),
          std::vector<std::string_view>(annotation::kList.begin(), annotation::kList.end()),
          std::vector<std::string_view>(change::kList.begin(), change::kList.end()),
          std::vector<std::string_view>{change::kAdded, change::kRemoved, change::kChanged},
          std::vector<std::string_view>(change::kKindList.begin(), change::kKindList.end()),
          std::vector<std::string_view>(explain::kList.begin(), explain::kList.end()),
          std::vector<std::string_view>(explain::kStepNames.begin(), explain::kStepNames.end()),
          std::vector<std::string_view>{explain::kMatched, explain::kRejected, explain::kLost, explain::kHigherVersion,
                                        explain::kSystemVolumeWins, explain::kLaterRegistration, explain::kFoundFirst,
                                        explain::kNotRegistered, explain::kNotRegisteredOrHidden, explain::kNoBundle}})
        for (std::string_view name : keys) EXPECT_NE(document_.find(quoted(name)), std::string::npos) << name;

    std::string matchFlags = document_.substr(document_.find("Flags of \"match\""));
    std::string lockFlags = document_.substr(document_.find("Flags of \"lock\""));
    for (uint64_t bit : discover::kBits) EXPECT_NE(matchFlags.find(hexBit(bit)), std::string::npos) << bit;
    for (uint64_t bit : hold::kBits) EXPECT_NE(lockFlags.find(hexBit(bit)), std::string::npos) << bit;

    for (std::string_view name : {kServiceName, kAnnotationChangeNotification, kManagerEntitlement, kUserPrefsDomain})
        EXPECT_NE(document_.find("`" + std::string(name) + "`"), std::string::npos) << name;
    EXPECT_NE(document_.find("the current one is " + std::to_string(kCurrentVersion) + ", and " +
                             std::to_string(kAcceptedOldVersion) + " is still accepted"),
              std::string::npos);
}

// Guards the limits of standing queries: each is named with its value in the document's table, so that a change of
// the constant cannot leave the document behind.
TEST_F(ProtocolDocument, StatesTheLimitsOfWatches) {
    for (auto [name, value] :
         {std::pair{"watch::kMaxPerClient", std::to_string(watch::kMaxPerClient)},
          std::pair{"watch::kMaxTotal", std::to_string(watch::kMaxTotal)},
          std::pair{"watch::kMaxQueuedBytes", std::to_string(watch::kMaxQueuedBytes >> 20) + " MiB"}})
        EXPECT_NE(document_.find("| `" + std::string(name) + "` | " + value + " |"), std::string::npos) << name;
    for (std::string_view event : {watch::kUpdate, watch::kResync})
        EXPECT_NE(document_.find(quoted(event)), std::string::npos) << event;
}

}  // namespace
}  // namespace bexil
