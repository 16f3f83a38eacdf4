#include <silvan/toppfbase.h>
