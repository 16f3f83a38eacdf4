#include <silvan/parserfactory.h>
