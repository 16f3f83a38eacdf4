#include <silvan/tpmfileparser.h>
