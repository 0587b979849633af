#pragma once
#include "../platform/test_root.h"

namespace sim_test {
using se_test::TestRoot;
}  // namespace sim_test
