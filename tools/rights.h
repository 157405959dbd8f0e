// What each TLS client of dpx-agentd may do, by the common name of its
// certificate, from a rights file:
//
//   # NAME       RIGHTS      NODES        PATHS
//   backup       read        *            *
//   deploy-ci    read,write  web1,web2    conf/ scripts/deploy.sh
//
// One client a line; '#' starts a comment. RIGHTS is read, write or
// read,write: read takes get_chunks, agent_query and list_nodes, write
// put_chunks. NODES is a comma-separated list of the node names a call's
// descriptor may carry, or *. PATHS, the rest of the line, are the paths a
// call may name, each a file or a directory and everything below it, after
// the path is cleaned as the depot cleans it ("a/../b" is "b"); * for all.
// A client without a line may do nothing.
#ifndef DPX_TOOLS_RIGHTS_H
#define DPX_TOOLS_RIGHTS_H

#include "dpx/dpx.h"

#include <cstring>
#include <fstream>
#include <map>
#include <optional>
#include <sstream>
#include <string>
#include <vector>

namespace dpxtools {

class Rights {
public:
    enum Access { kRead = 1, kWrite = 2 };

    // The rights of `file`, or nullopt with `error` naming the bad line.
    static std::optional<Rights> load(const std::string &file, std::string &error)
    {
        std::ifstream in(file);
        if (!in) {
            error = "cannot read " + file;
            return std::nullopt;
        }
        Rights rights;
        int number = 0;
        for (std::string line; std::getline(in, line);) {
            ++number;
            std::istringstream words(line.substr(0, line.find('#')));
            std::string name, access, nodes;
            if (!(words >> name))
                continue;
            Grant grant;
            words >> access >> nodes;
            grant.access = access == "read" ? kRead : access == "write" ? kWrite
                                                : access == "read,write" ? kRead | kWrite : 0;
            grant.nodes = split(nodes, ',');
            for (std::string path; words >> path;)
                grant.paths.push_back(path == "*" ? path : clean(path).value_or(""));
            if (grant.access == 0 || grant.nodes.empty() || grant.paths.empty()) {
                error = file + ":" + std::to_string(number) + ": want NAME read|write|read,write NODES PATHS";
                return std::nullopt;
            }
            rights.grants_[name] = grant;
        }
        return rights;
    }

    // Whether client `name` may have `access` to `path` (a field of `width`
    // characters, NUL-ended within it) of `node`.
    bool allows(const std::string &name, int access, const char *node, size_t node_width, const char *path,
                size_t path_width) const
    {
        auto grant = grants_.find(name);
        if (grant == grants_.end() || (grant->second.access & access) != access)
            return false;
        if (node == nullptr)
            return true;
        const size_t node_length = strnlen(node, node_width), path_length = strnlen(path, path_width);
        if (node_length == node_width || path_length == path_width)
            return false;
        std::optional<std::string> cleaned = clean(std::string(path, path_length));
        if (!cleaned)
            return false;
        return matches(grant->second.nodes, std::string(node, node_length), false) &&
               matches(grant->second.paths, *cleaned, true);
    }

private:
    struct Grant {
        int access = 0;
        std::vector<std::string> nodes;
        std::vector<std::string> paths;
    };

    static std::vector<std::string> split(const std::string &text, char separator)
    {
        std::vector<std::string> parts;
        std::istringstream in(text);
        for (std::string part; std::getline(in, part, separator);)
            if (!part.empty())
                parts.push_back(part);
        return parts;
    }

    // `text` cleaned as the depot cleans a path, without a closing '/'.
    static std::optional<std::string> clean(const std::string &text)
    {
        std::vector<char> cleaned(text.size() + 1);
        if (dpx_cleanup_rel_path(text.c_str(), cleaned.data()) != DPX_OK)
            return std::nullopt;
        std::string result = cleaned.data();
        while (!result.empty() && result.back() == '/')
            result.pop_back();
        return result;
    }

    // A node matches a name of the list; a path a file of the list, or lies
    // below a directory of it.
    static bool matches(const std::vector<std::string> &list, const std::string &value, bool below)
    {
        for (const std::string &entry : list)
            if (entry == "*" || entry == value ||
                (below && value.size() > entry.size() && value.compare(0, entry.size(), entry) == 0 &&
                 value[entry.size()] == '/'))
                return true;
        return false;
    }

    std::map<std::string, Grant> grants_;
};

}  // namespace dpxtools

#endif
