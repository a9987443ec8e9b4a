// expected: needs coroutines: compile as C++20
#include <cellar/host/Coroutines.h>
