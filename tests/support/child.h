// Runs a piece of a test in a forked child, for state that lives once per
// process (caches filled on first use, registrations).
#ifndef DPX_TEST_CHILD_H
#define DPX_TEST_CHILD_H

#include <functional>
#include <string>

namespace dpxtest {

// Runs `body` in a child process. The child exits 0 when `body` returns an
// empty string, else prints it and exits 1. Returns what the child reported:
// empty on success.
std::string in_child(const std::function<std::string()> &body);

}  // namespace dpxtest

#endif
