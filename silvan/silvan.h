// Everything the library exports, and the platform types its interface uses.
#pragma once

// Platform: exception family with FormatString and _, parameter-table reader, file names,
// disk and string-list utilities, channel lists, XML base, PROC reader and generator library.
#include <kestrel/channels.h>
#include <kestrel/disk.h>
#include <kestrel/exception.h>
#include <kestrel/file.h>
#include <kestrel/mfileparser.h>
#include <kestrel/processparams.h>
#include <kestrel/stringlist.h>
#include <kestrel/trueortho.h>
#include <kestrel/xmlparser.h>

// The library: parameter-file parsers and writers, scene description with its footprint
// polygon (point2_t, kestrel::tin::Polygon, RadiometricDiff), process base, free functions.
#include <silvan/filelistparser.h>
#include <silvan/parserfactory.h>
#include <silvan/polygon.h>
#include <silvan/toimgsetparser.h>
#include <silvan/tomfileparser.h>
#include <silvan/toppfbase.h>
#include <silvan/tosceneparser.h>
#include <silvan/tpmfileparser.h>
#include <silvan/utils.h>
