// File types of process outputs and the GDAL formats that write them.
#pragma once

#include <string>
#include <vector>

#include <kestrel/export.h>

namespace kestrel {
namespace core {

// The GDAL format (driver short name) of a file type, compared without regard to case:
// tif/tiff GTiff, cog COG, vrt VRT, img HFA, gpkg GPKG, png PNG, jpg/jpeg JPEG, hdr/envi ENVI,
// ntf NITF, mem MEM, and a few more (KnownFileTypes). A GDAL raster driver's own short name is
// accepted as it is and returned as GDAL spells it. Anything else throws ParameterException
// type 1 whose parameter name is "file type", whose value is the text and whose expected
// values list the known file types.
KESTREL_API std::string FType2FormatName(const std::string& fileType);

// The file types FType2FormatName knows, in lower case.
KESTREL_API std::vector<std::string> KnownFileTypes();

// The format of a file name's extension ("a/b.TIF" -> "GTiff"); empty when the extension is
// missing or not a known file type.
KESTREL_API std::string FormatNameOfPath(const std::string& path);

// The usual extension of files of a GDAL format, without the dot: "tif" for GTiff and COG,
// the driver's own (GDAL_DMD_EXTENSION) for the others; empty when the driver names none.
KESTREL_API std::string FileExtension(const std::string& format);

// Checks GDAL creation options "NAME=VALUE" against the creation option list of the format's
// driver, as gdal_translate's -co does: an option the driver does not know, or a value it does
// not allow, throws ParameterException type 1 whose parameter name is "creation option" and whose
// value is the option, with GDAL's reason.
KESTREL_API void CheckCreationOptions(const std::string& format,
                                      const std::vector<std::string>& options);

}  // namespace core
}  // namespace kestrel
