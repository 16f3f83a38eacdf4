#include <silvan/utils.h>
