// The entries of one location broker: registration, removal, walks.
#include "database.h"

#include "trc/trc1.h"

#include <algorithm>
#include <cstring>

TRC1_DEFINE_UNIT("broker database");

namespace ncs::lb {

namespace {

// Most entries a broker holds.
constexpr size_t kMaxEntries = 1024;

bool matches(const uuid__t &wanted, const uuid__t &have)
{
    return uuid__equal(&wanted, &uuid__nil) || uuid__equal(&wanted, &have);
}

// Same object, type, interface and address.
bool same_key(const lb__entry_t &a, const lb__entry_t &b)
{
    return uuid__equal(&a.object, &b.object) && uuid__equal(&a.obj_type, &b.obj_type) &&
           uuid__equal(&a.obj_interface, &b.obj_interface) && a.saddr_len == b.saddr_len &&
           std::memcmp(a.saddr.bytes, b.saddr.bytes, a.saddr_len) == 0;
}

}  // namespace

std::string describe(const lb__entry_t &entry)
{
    char uuid[37];
    uuid__encode(&entry.obj_interface, uuid);
    char host[64];
    uint32_t host_len = sizeof host;
    uint32_t port = 0;
    uint32_t status;
    socket__to_name(&entry.saddr, entry.saddr_len, host, &host_len, &port, &status);
    if (status != rpc__s_ok)
        return std::string("interface ") + uuid + " at an address of family " + std::to_string(entry.saddr.sa.sa_family);
    return std::string("interface ") + uuid + " at " + host + ":" + std::to_string(port);
}

uint32_t Database::add(const lb__entry_t &entry, uint64_t owner)
{
    TRC1_FUNCTION();
    lb__entry_t clean{};
    clean.object = entry.object;
    clean.obj_type = entry.obj_type;
    clean.obj_interface = entry.obj_interface;
    clean.flags = entry.flags;
    std::memcpy(clean.annotation, entry.annotation, LB_ANNOTATION_LEN - 1);
    clean.saddr_len = entry.saddr_len;
    std::memcpy(clean.saddr.bytes, entry.saddr.bytes, entry.saddr_len);

    std::lock_guard lock(mutex_);
    auto same = [&](const Record &r) { return same_key(r.entry, clean); };
    auto held = std::find_if(records_.begin(), records_.end(), same);
    if (held != records_.end() && held->owner == owner) {
        held->entry = clean;
        return rpc__s_ok;
    }
    std::erase_if(records_, same);
    if (records_.size() >= kMaxEntries) {
        TRC1_ERROR_MSG("database full: %s refused", describe(clean).c_str());
        return lb__s_database_full;
    }
    if (next_serial_ > kMaxSerial)
        renumber();
    records_.push_back(Record{clean, next_serial_++, owner});
    TRC1_FLOW_MSG("registered %s (connection %llu)", describe(clean).c_str(),
                  static_cast<unsigned long long>(owner));
    return rpc__s_ok;
}

uint32_t Database::remove(const lb__entry_t &entry)
{
    TRC1_FUNCTION();
    std::lock_guard lock(mutex_);
    if (std::erase_if(records_, [&](const Record &r) { return same_key(r.entry, entry); }) == 0)
        return lb__s_not_registered;
    TRC1_FLOW_MSG("unregistered %s", describe(entry).c_str());
    return rpc__s_ok;
}

void Database::remove_owner(uint64_t owner)
{
    TRC1_FUNCTION();
    std::lock_guard lock(mutex_);
    size_t removed = std::erase_if(records_, [owner](const Record &r) { return r.owner == owner; });
    if (removed > 0)
        TRC1_FLOW_MSG("connection %llu closed: %zu entries removed", static_cast<unsigned long long>(owner),
                      removed);
}

ReplyHead Database::lookup(const Query &query, std::vector<lb__entry_t> &found) const
{
    ReplyHead head{lb__s_not_registered, query.position, 0};
    uint32_t max = std::min(query.max_results, kMaxResultsPerReply);
    if (max == 0) {
        head.status = lb__s_bad_argument;
        return head;
    }
    std::lock_guard lock(mutex_);
    for (auto r = records_.rbegin(); r != records_.rend() && found.size() < max; ++r) {
        if (query.position != 0 && r->serial >= query.position)
            continue;
        if (!matches(query.object, r->entry.object) || !matches(query.type, r->entry.obj_type) ||
            !matches(query.interface, r->entry.obj_interface))
            continue;
        found.push_back(r->entry);
        head.position = r->serial;
    }
    head.count = static_cast<uint32_t>(found.size());
    if (head.count > 0)
        head.status = rpc__s_ok;
    return head;
}

void Database::renumber()
{
    next_serial_ = 1;
    for (Record &r : records_)
        r.serial = next_serial_++;
}

}  // namespace ncs::lb
