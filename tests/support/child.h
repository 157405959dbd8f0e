// Runs a piece of a test in a forked child, for state that lives once per
// process (caches filled on first use, registrations).
#ifndef DPX_TEST_CHILD_H
#define DPX_TEST_CHILD_H

#include <functional>
#include <string>

namespace dpxtest {

// Runs `body` in a child process, which reports what `body` returns: empty
// for success. Returns that report, or why the child failed without one.
std::string in_child(const std::function<std::string()> &body);

}  // namespace dpxtest

#endif
