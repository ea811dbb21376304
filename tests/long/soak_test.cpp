// Ten minutes of ticks (QUELTA_SOAK_SECONDS to change) with waits alongside,
// through the loaded library: the load tests with their tick run made long.
#define QUELTA_SOAK 1
#include "../integration/library_load_test.cpp"
