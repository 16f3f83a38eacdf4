#include <kestrel/formats.h>

#include <algorithm>
#include <cctype>
#include <utility>

#include <cpl_string.h>
#include <gdal.h>

#include <kestrel/exception.h>
#include <kestrel/rasterio.h>

#include <kestrel/gdalsupport.h>

namespace kestrel {
namespace core {

namespace {

// File types in lower case and their GDAL drivers.
const std::pair<const char*, const char*> kFileTypes[] = {
    {"tif", "GTiff"}, {"tiff", "GTiff"}, {"gtiff", "GTiff"},     {"cog", "COG"},
    {"vrt", "VRT"},   {"img", "HFA"},    {"hfa", "HFA"},         {"gpkg", "GPKG"},
    {"png", "PNG"},   {"jpg", "JPEG"},   {"jpeg", "JPEG"},       {"hdr", "ENVI"},
    {"envi", "ENVI"}, {"ntf", "NITF"},   {"nitf", "NITF"},       {"mem", "MEM"},
    {"bmp", "BMP"},   {"gif", "GIF"},    {"jp2", "JP2OpenJPEG"}, {"webp", "WEBP"},
    {"nc", "netCDF"}, {"kea", "KEA"},    {"rst", "RST"},         {"asc", "AAIGrid"},
    {"bt", "BT"},     {"rsw", "RMF"},    {"mbtiles", "MBTiles"}, {"xyz", "XYZ"},
};

std::string Lower(std::string text) {
    std::transform(text.begin(), text.end(), text.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    return text;
}

std::string Lookup(const std::string& fileType) {
    const std::string key = Lower(fileType);
    for (const auto& entry : kFileTypes) {
        if (key == entry.first)
            return entry.second;
    }
    if (fileType.empty() || fileType.find('\0') != std::string::npos)
        return "";
    gdalsupport::EnsureRegistered();
    GDALDriverH driver = GDALGetDriverByName(fileType.c_str());
    if (driver == nullptr) {
        // GDAL's names are case-blind too.
        for (int i = 0; i < GDALGetDriverCount(); ++i) {
            GDALDriverH d = GDALGetDriver(i);
            if (Lower(GDALGetDriverShortName(d)) == key) {
                driver = d;
                break;
            }
        }
    }
    if (driver == nullptr || GDALGetMetadataItem(driver, GDAL_DCAP_RASTER, nullptr) == nullptr)
        return "";
    return GDALGetDriverShortName(driver);
}

}  // namespace

std::vector<std::string> KnownFileTypes() {
    std::vector<std::string> types;
    for (const auto& entry : kFileTypes)
        types.emplace_back(entry.first);
    return types;
}

std::string FType2FormatName(const std::string& fileType) {
    std::string format = Lookup(fileType);
    if (format.empty()) {
        std::string known;
        for (const auto& type : KnownFileTypes())
            known += (known.empty() ? "" : ", ") + type;
        known += ", or a GDAL raster driver's short name";
        KESTREL_THROW(ParameterException, "file type", ParameterException::Unsupported, fileType,
                      known,
                      FormatString("Unknown output file type \"%s\"; known file types: %s",
                                   fileType.c_str(), known.c_str()));
    }
    if (auto observer = datasources::RasterIOObserver::Current())
        observer->FormatNameLookedUp(fileType, format);
    return format;
}

std::string FormatNameOfPath(const std::string& path) {
    const std::size_t slash = path.find_last_of("/\\");
    const std::size_t dot = path.find_last_of('.');
    if (dot == std::string::npos || (slash != std::string::npos && dot < slash))
        return "";
    const std::string key = Lower(path.substr(dot + 1));
    for (const auto& entry : kFileTypes) {
        if (key == entry.first)
            return entry.second;
    }
    return "";
}

std::string FileExtension(const std::string& format) {
    if (EQUAL(format.c_str(), "GTiff") || EQUAL(format.c_str(), "COG"))
        return "tif";
    gdalsupport::EnsureRegistered();
    GDALDriverH driver = GDALGetDriverByName(format.c_str());
    const char* extension =
        driver != nullptr ? GDALGetMetadataItem(driver, GDAL_DMD_EXTENSION, nullptr) : nullptr;
    return extension != nullptr ? Lower(extension) : "";
}

void CheckCreationOptions(const std::string& format, const std::vector<std::string>& options) {
    gdalsupport::EnsureRegistered();
    GDALDriverH driver = GDALGetDriverByName(format.c_str());
    if (driver == nullptr)
        FType2FormatName(format);  // throws, naming the format
    for (const std::string& option : options) {
        const std::size_t equals = option.find('=');
        std::string reason;
        if (equals == std::string::npos || equals == 0) {
            reason = "a creation option is written NAME=VALUE";
        } else {
            const char* list[] = {option.c_str(), nullptr};
            gdalsupport::ErrorCapture errors;
            if (!GDALValidateCreationOptions(driver, const_cast<char**>(list)))
                reason = errors.Reason();
        }
        if (!reason.empty()) {
            const std::string name = GDALGetDriverShortName(driver);
            const std::string known =
                "the creation options that gdalinfo --format " + name + " lists";
            KESTREL_THROW(ParameterException, "creation option", ParameterException::Unsupported,
                          option, known,
                          FormatString("Creation option \"%s\" of GDAL's %s driver: %s (see %s)",
                                       option.c_str(), name.c_str(), reason.c_str(),
                                       known.c_str()));
        }
    }
}

}  // namespace core
}  // namespace kestrel
