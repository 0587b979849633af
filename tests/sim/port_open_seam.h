#pragma once
// The engine tests' definition of asyncCmdOpenPort (linked in place of the
// product's): it opens like the product and lets a test act on the worker's
// thread just before a given attempt, so that no test races the retries.
#include <functional>
#include <string>

namespace sim_test {

// Called with the path and the 1-based attempt number for that path, on the
// worker's thread, before the open. Cleared by setting an empty function.
void setBeforeOpen(std::function<void(const std::string&, int)> hook);

}  // namespace sim_test
