#pragma once
// The front tests' uptime (linked in place of the system's): the settling
// delay's branches are chosen by the test, not by the machine.
namespace sim_test {
// Seconds the fake reports, or a failure when `fails`. Default: 1000 s.
void setUptime(long seconds, bool fails = false);
}  // namespace sim_test
