#include "WatchView.h"

#include <algorithm>

#include "bexil/Protocol.h"
#include "client/JsonText.h"

namespace bexil::tool {

namespace {

namespace formKey = protocol::form;

std::string text(const Value& form, std::string_view key) {
    const Value& value = form.get(key);
    return value.isString() && !value.stringView().empty() ? std::string(value.stringView()) : std::string("-");
}

}  // namespace

std::string WatchView::describe(const Value& form) {
    return text(form, formKey::kIdentifier) + " " + text(form, formKey::kVersion) + " " + text(form, formKey::kUuid) +
           " " + text(form, formKey::kPath);
}

void WatchView::result(const std::vector<Value>& forms, uint64_t generation) {
    plugIns_.clear();
    for (const Value& form : forms) plugIns_[text(form, formKey::kUuid)] = form;
    generation_ = generation;
    switch (style_) {
        case Style::Table:
            draw();
            return;
        case Style::Lines:
            // "=" starts a whole result: a reader forgets what it had and takes the "+" lines that follow.
            std::fprintf(out_, "%llu = %zu\n", static_cast<unsigned long long>(generation), forms.size());
            for (const Value& form : forms)
                std::fprintf(out_, "%llu + %s\n", static_cast<unsigned long long>(generation), describe(form).c_str());
            break;
        case Style::Json: {
            MutableDictionary line;
            line.set(protocol::key::kGeneration, Value::uint64(generation));
            line.set(protocol::key::kMatches, Value::array(forms));
            std::fprintf(out_, "%s\n", toJson(line.take(), JsonLayout::OneLine).c_str());
            break;
        }
    }
    std::fflush(out_);
}

void WatchView::change(const DaemonClient::WatchChange& change) {
    for (const std::string& uuid : change.removed) plugIns_.erase(uuid);
    for (const Value& form : change.added) plugIns_[text(form, formKey::kUuid)] = form;
    for (const Value& form : change.changed) plugIns_[text(form, formKey::kUuid)] = form;
    generation_ = change.generation;
    const auto generation = static_cast<unsigned long long>(change.generation);
    switch (style_) {
        case Style::Table:
            draw();
            return;
        case Style::Lines:
            for (const std::string& uuid : change.removed) std::fprintf(out_, "%llu - %s\n", generation, uuid.c_str());
            for (const Value& form : change.added)
                std::fprintf(out_, "%llu + %s\n", generation, describe(form).c_str());
            for (const Value& form : change.changed)
                std::fprintf(out_, "%llu ~ %s\n", generation, describe(form).c_str());
            break;
        case Style::Json: {
            MutableDictionary line;
            line.set(protocol::key::kGeneration, Value::uint64(change.generation));
            line.set(protocol::key::kAdded, Value::array(change.added));
            std::vector<Value> removed;
            for (const std::string& uuid : change.removed) removed.push_back(Value::string(uuid));
            line.set(protocol::key::kRemoved, Value::array(std::move(removed)));
            line.set(protocol::key::kChanged, Value::array(change.changed));
            std::fprintf(out_, "%s\n", toJson(line.take(), JsonLayout::OneLine).c_str());
            break;
        }
    }
    std::fflush(out_);
}

void WatchView::resync(uint64_t generation) {
    if (style_ == Style::Table) return;  // the table is drawn again with the result that follows
    if (style_ == Style::Lines)
        std::fprintf(out_, "%llu resync\n", static_cast<unsigned long long>(generation));
    else
        std::fprintf(out_, "{\"%s\":%llu,\"%s\":\"%s\"}\n", protocol::key::kGeneration.data(),
                     static_cast<unsigned long long>(generation), protocol::key::kEvent.data(),
                     protocol::watch::kResync.data());
    std::fflush(out_);
}

void WatchView::draw() {
    struct Row {
        std::string identifier, version, uuid, path;
    };
    std::vector<Row> rows;
    for (const auto& [uuid, form] : plugIns_)
        rows.push_back(
            {text(form, formKey::kIdentifier), text(form, formKey::kVersion), uuid, text(form, formKey::kPath)});
    std::sort(rows.begin(), rows.end(), [](const Row& a, const Row& b) {
        return a.identifier != b.identifier ? a.identifier < b.identifier : a.uuid < b.uuid;
    });
    rows.insert(rows.begin(), Row{"IDENTIFIER", "VERSION", "UUID", "PATH"});
    size_t widths[3] = {0, 0, 0};
    for (const Row& row : rows) {
        widths[0] = std::max(widths[0], row.identifier.size());
        widths[1] = std::max(widths[1], row.version.size());
        widths[2] = std::max(widths[2], row.uuid.size());
    }
    // Back to where the previous drawing began, and everything below it erased: the table changes in place.
    if (drawnLines_ > 0) std::fprintf(out_, "\033[%zuA\r\033[J", drawnLines_);
    for (const Row& row : rows)
        std::fprintf(out_, "%-*s  %-*s  %-*s  %s\n", static_cast<int>(widths[0]), row.identifier.c_str(),
                     static_cast<int>(widths[1]), row.version.c_str(), static_cast<int>(widths[2]), row.uuid.c_str(),
                     row.path.c_str());
    std::fprintf(out_, "generation %llu, %zu plug-ins; interrupt to stop\n",
                 static_cast<unsigned long long>(generation_), plugIns_.size());
    drawnLines_ = rows.size() + 1;
    std::fflush(out_);
}

}  // namespace bexil::tool
