#pragma once
// The daemon's entry: chooses and registers the instances, then serves calls
// on the RPC thread pool. Returns only on failure, always with status 1.
int qvese_service_main();
