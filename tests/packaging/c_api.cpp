// The same checks as c_api.c, compiled as C++: the headers work both ways.
#include "c_api.c"
