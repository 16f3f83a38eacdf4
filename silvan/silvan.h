// Everything the library exports, and the platform types its interface uses.
#pragma once

#include <kestrel/exception.h>
#include <kestrel/mfileparser.h>

#include <silvan/filelistparser.h>
#include <silvan/parserfactory.h>
#include <silvan/polygon.h>
#include <silvan/toimgsetparser.h>
#include <silvan/tomfileparser.h>
#include <silvan/toppfbase.h>
#include <silvan/tosceneparser.h>
#include <silvan/tpmfileparser.h>
#include <silvan/utils.h>
