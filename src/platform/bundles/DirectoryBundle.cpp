#include "platform/bundles/DirectoryBundle.h"

#include <cerrno>
#include <system_error>
#include <utility>

#include "base/Document.h"

namespace bexil {

namespace fs = std::filesystem;

namespace {

// What reading a directory's information document gave: a value, a reason it could not be read, or neither when
// the directory simply has no document.
struct InfoRead {
    std::optional<Value> value;
    std::string problem;
};

InfoRead readInfo(const fs::path& root) {
    InfoRead out;
    fs::path file = root / DirectoryBundle::kInfoFileName;
    std::error_code ec;
    fs::file_status status = fs::status(file, ec);
    if (status.type() == fs::file_type::not_found) return out;
    if (ec) {
        out.problem = "cannot reach " + file.string() + ": " + ec.message();
        return out;
    }
    if (!fs::is_regular_file(status)) {
        out.problem = file.string() + " is not a regular file";
        return out;
    }
    std::uintmax_t size = fs::file_size(file, ec);
    if (ec) {
        out.problem = "cannot reach " + file.string() + ": " + ec.message();
        return out;
    }
    if (size > DirectoryBundle::kMaxInfoBytes) {
        out.problem = file.string() + " is larger than " + std::to_string(DirectoryBundle::kMaxInfoBytes) + " bytes";
        return out;
    }
    Result<Value> read = Document::readFile(file);
    if (!read) {
        out.problem = read.error().description();
        return out;
    }
    out.value = std::move(read).value();
    return out;
}

// The executable that an information dictionary names, as a path under `root`. None when it names none; a name
// that is not a relative path staying inside the bundle is a problem, never followed.
std::optional<fs::path> namedExecutable(const fs::path& root, const Value& info, std::string& problem) {
    const Value* named = info.find(DirectoryBundle::kExecutableKey);
    if (named == nullptr) return std::nullopt;
    const std::string* text = named->getString();
    if (text == nullptr || text->empty() || text->find('\0') != std::string::npos) {
        problem = "BDBundleExecutable is not a path";
        return std::nullopt;
    }
    fs::path relative = fs::path(*text).lexically_normal();
    if (relative.is_absolute() || relative.empty() || relative == "." || *relative.begin() == "..") {
        problem = "BDBundleExecutable \"" + *text + "\" is not a path inside the bundle";
        return std::nullopt;
    }
    return root / relative;
}

// Fills in what a bundle whose root is known answers.
DirectoryBundle::Parts partsForRoot(std::string requested, const fs::path& root, InfoRead read) {
    DirectoryBundle::Parts parts;
    parts.requestedPath = std::move(requested);
    parts.root = root.string();
    parts.problem = std::move(read.problem);
    if (read.value && read.value->isDictionary()) {
        std::string problem;
        if (std::optional<fs::path> executable = namedExecutable(root, *read.value, problem)) {
            std::error_code ec;
            if (fs::is_regular_file(*executable, ec))
                parts.executable = executable->string();
            else
                problem = "executable " + executable->string() + " is missing";
        }
        if (!problem.empty()) parts.problem = std::move(problem);
    }
    parts.info = std::move(read.value);
    return parts;
}

DirectoryBundle::Parts nothingAt(std::string requested, std::string problem) {
    DirectoryBundle::Parts parts;
    parts.requestedPath = std::move(requested);
    parts.problem = std::move(problem);
    return parts;
}

DirectoryBundle::Parts openDirectory(const fs::path& path) {
    std::error_code ec;
    fs::path root = fs::canonical(path, ec);
    if (ec) return nothingAt(path.string(), ec.message());
    if (!fs::is_directory(root, ec)) return nothingAt(path.string(), "not a directory");
    return partsForRoot(path.string(), root, readInfo(root));
}

DirectoryBundle::Parts openContainingExecutable(const fs::path& path) {
    std::error_code ec;
    fs::path executable = fs::canonical(path, ec);
    if (ec) return nothingAt(path.string(), ec.message());
    if (!fs::is_regular_file(executable, ec)) return nothingAt(path.string(), "not an executable file");

    // The canonical path has no symbolic links and no dot components, so the walk ends at "/" after at most as
    // many steps as the path has components.
    for (fs::path dir = executable.parent_path();; dir = dir.parent_path()) {
        InfoRead read = readInfo(dir);
        if (read.value && read.value->isDictionary()) {
            std::string ignored;
            if (std::optional<fs::path> named = namedExecutable(dir, *read.value, ignored)) {
                // A bundle may reach its executable through a link of its own; what counts is the file it names.
                fs::path resolved = fs::canonical(*named, ec);
                if (!ec && resolved == executable) return partsForRoot(path.string(), dir, std::move(read));
            }
        }
        if (dir == dir.root_path() || dir.parent_path() == dir) break;
    }
    return nothingAt(path.string(), "no bundle above it names it as its executable");
}

}  // namespace

DirectoryBundle::DirectoryBundle(Parts parts)
    : requestedPath_(std::move(parts.requestedPath)),
      root_(std::move(parts.root)),
      info_(std::move(parts.info)),
      executable_(std::move(parts.executable)),
      problem_(std::move(parts.problem)) {}

std::shared_ptr<const DirectoryBundle> DirectoryBundle::create(const fs::path& path, BundleLookup lookup) {
    if (path.empty()) return std::make_shared<const DirectoryBundle>(nothingAt("", "empty path"));
    // The system calls would see the path cut short at the NUL and resolve some other file.
    if (path.native().find('\0') != std::string::npos)
        return std::make_shared<const DirectoryBundle>(nothingAt(path.string(), "path contains a NUL byte"));
    switch (lookup) {
        case BundleLookup::Directory:
            return std::make_shared<const DirectoryBundle>(openDirectory(path));
        case BundleLookup::ContainingExecutable:
            return std::make_shared<const DirectoryBundle>(openContainingExecutable(path));
    }
    return std::make_shared<const DirectoryBundle>(nothingAt(path.string(), "unknown look-up mode"));
}

std::shared_ptr<const DirectoryBundle> DirectoryBundle::createMain() {
    return create("/proc/self/exe", BundleLookup::ContainingExecutable);
}

std::optional<std::string> DirectoryBundle::stringProperty(BundleStringProperty property) const {
    switch (property) {
        case BundleStringProperty::BundlePath:
        case BundleStringProperty::SupportPath:
            return root_;
        case BundleStringProperty::ExecutablePath:
            return executable_;
    }
    return std::nullopt;
}

std::optional<Value> DirectoryBundle::infoDictionary() const { return info_; }

std::string DirectoryBundle::description() const {
    std::string out;
    if (root_) {
        out = "<bundle " + *root_;
        if (executable_) out += " executable=" + *executable_;
        if (!info_) out += " without Info.vrec";
    } else {
        out = "<no bundle at " + requestedPath_;
    }
    if (!problem_.empty()) out += ": " + problem_;
    return out + ">";
}

}  // namespace bexil
