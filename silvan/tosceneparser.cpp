#include <silvan/tosceneparser.h>
