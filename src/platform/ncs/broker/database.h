// The entries of one location broker. Private to src/platform/ncs/broker.
#ifndef NCS_BROKER_DATABASE_H
#define NCS_BROKER_DATABASE_H

#include "broker.h"

#include <mutex>
#include <vector>

namespace ncs::lb {

// The entries of one broker. Every entry has an owner, the connection that
// registered it, and a serial number, higher for newer registrations, that
// walks use as their position. All members are callable from any thread.
class Database {
public:
    // Adds `entry`, replacing one with the same key: rpc__s_ok or
    // lb__s_database_full. The connection that holds the entry already only
    // renews it: the entry keeps its place among the others, so a server
    // that registers again now and then doesn't push newer ones back.
    uint32_t add(const lb__entry_t &entry, uint64_t owner);

    // Removes the entry with the key of `entry`: rpc__s_ok or lb__s_not_registered.
    uint32_t remove(const lb__entry_t &entry);

    // Removes every entry of `owner`.
    void remove_owner(uint64_t owner);

    // The next entries of a walk, newest first: those that match and are
    // older than `query.position` (0: all). The reply's position is the
    // serial of the last one found, or the query's when none is.
    ReplyHead lookup(const Query &query, std::vector<lb__entry_t> &found) const;

private:
    struct Record {
        lb__entry_t entry;
        uint32_t serial;
        uint64_t owner;
    };

    // Serials 1..n again, in the same order, once they would pass kMaxSerial.
    // A walk under way may see entries twice then; it still ends.
    void renumber();

    // Guards the members below. Taken alone: nothing else is locked under it.
    mutable std::mutex mutex_;
    std::vector<Record> records_;  // oldest first: serials ascend
    uint32_t next_serial_ = 1;
};


}  // namespace ncs::lb

#endif
