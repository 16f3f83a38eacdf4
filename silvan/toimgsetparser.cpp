#include <silvan/toimgsetparser.h>
