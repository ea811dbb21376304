#include "c_api.c"  // the same program as C++: the headers work both ways
