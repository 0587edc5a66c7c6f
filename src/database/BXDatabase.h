#pragma once

// The daemon's plug-in database: owns the record cache, the annotation store and the registry workspace, and tells
// its delegate about uninstalls. This is the part that process start-up needs (the database path, the cache limit
// and the delegate); the cache and the registry grow on it.

#include <atomic>
#include <optional>
#include <string>

#include "database/BXDatabaseDelegate.h"

namespace bexil {

class BXDatabase {
  public:
    // Default for the largest number of cached records before the cache is emptied.
    static constexpr unsigned kDefaultCacheLimit = 1000000;

    virtual ~BXDatabase() = default;

    // The annotation document path (none: the store's default location).
    const std::optional<std::string>& databasePath() const { return databasePath_; }

    unsigned cacheLimit() const { return cacheLimit_.load(std::memory_order_relaxed); }
    void setCacheLimit(unsigned limit) { cacheLimit_.store(limit, std::memory_order_relaxed); }

    // Held weakly: the delegate (the server) owns the database, never the other way round.
    BXDatabaseDelegate* delegate() const { return delegate_.load(); }
    void setDelegate(BXDatabaseDelegate* delegate) { delegate_.store(delegate); }

  protected:
    // initWithDatabase: a path or none; subclasses finish construction and report failure through initWithDatabase.
    explicit BXDatabase(std::optional<std::string> databasePath);
    // Whether the database could be built (its stores opened); false makes the server's construction fail.
    bool initWithDatabase();

  private:
    std::optional<std::string> databasePath_;
    std::atomic<unsigned> cacheLimit_{kDefaultCacheLimit};
    std::atomic<BXDatabaseDelegate*> delegate_{nullptr};
};

}  // namespace bexil
