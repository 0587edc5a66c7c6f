#include "database/BXDatabase.h"

namespace bexil {

BXDatabase::BXDatabase(std::optional<std::string> databasePath) : databasePath_(std::move(databasePath)) {}

bool BXDatabase::initWithDatabase() {
    // Nothing can fail yet: the stores that can (the registry, the annotation document) open here as they arrive.
    return true;
}

}  // namespace bexil
