// The ortho-process utilities: source datasets and channel groups, sensor models, the ortho
// output layout and footprint, and metadata transfer.
#pragma once

#include <string>
#include <vector>

#include <kestrel/crs.h>
#include <kestrel/datasources.h>
#include <kestrel/export.h>

// ---------------------------------------------------------------------------------------------
// Source datasets and channel groups

// (end of source datasets and channel groups)

// ---------------------------------------------------------------------------------------------
// Sensor models, output layout, footprint and metadata transfer

// (end of sensor models, output layout, footprint and metadata transfer)
