// What an ortho inherits from its source raster.
#include <cmath>
#include <memory>

#include <gdal_priv.h>

#include <kestrel/exception.h>
#include <kestrel/orthoutils.h>

#include <kestrel/gdalsupport.h>

namespace kestrel {
namespace processes {
namespace ortho {

namespace {

struct GdalCloser {
    void operator()(GDALDataset* dataset) const { GDALClose(dataset); }
};
using DatasetPtr = std::unique_ptr<GDALDataset, GdalCloser>;

DatasetPtr OpenRaster(const std::string& path, bool update, const SourceLocation& at) {
    gdalsupport::EnsureRegistered();
    gdalsupport::ErrorCapture errors;
    DatasetPtr dataset(GDALDataset::Open(
        path.c_str(), GDAL_OF_RASTER | (update ? GDAL_OF_UPDATE : GDAL_OF_READONLY)));
    if (!dataset) {
        KESTREL_THROW_AT(at, FileAccessException, path, FileAccessException::OpenFailed,
                         FormatString("\"%s\" cannot be opened as a raster%s: %s", path.c_str(),
                                      update ? " for update" : "", errors.Reason().c_str()));
    }
    return dataset;
}

}  // namespace

OrthoMetadataTransfer::OrthoMetadataTransfer(double noDataValue) : noDataValue_(noDataValue) {}
OrthoMetadataTransfer::~OrthoMetadataTransfer() = default;

void OrthoMetadataTransfer::Transfer(const std::string& sourcePath, const std::string& orthoPath,
                                     const std::vector<unsigned int>& channels) const {
    DatasetPtr source = OpenRaster(sourcePath, false, KESTREL_HERE);
    DatasetPtr ortho = OpenRaster(orthoPath, true, KESTREL_HERE);
    const int count = ortho->GetRasterCount();
    if (!channels.empty() && channels.size() != static_cast<std::size_t>(count)) {
        KESTREL_THROW(DataException,
                      FormatString("%zu source channels were given for the %d channels of \"%s\"",
                                   channels.size(), count, orthoPath.c_str()));
    }
    for (int i = 1; i <= count; ++i) {
        const unsigned int from =
            channels.empty() ? static_cast<unsigned int>(i) : channels[static_cast<size_t>(i - 1)];
        if (from < 1 || from > static_cast<unsigned int>(source->GetRasterCount())) {
            KESTREL_THROW(DataException,
                          FormatString("\"%s\" has no channel %u (it has %d)", sourcePath.c_str(),
                                       from, source->GetRasterCount()));
        }
    }
    gdalsupport::ErrorCapture errors;
    // The default domain only: the georeferencing domains (RPC, GCPs, geolocation) describe
    // the source's geometry, which the ortho does not share.
    ortho->SetMetadata(source->GetMetadata());
    for (int i = 1; i <= count; ++i) {
        const int from =
            channels.empty() ? i : static_cast<int>(channels[static_cast<size_t>(i - 1)]);
        GDALRasterBand* in = source->GetRasterBand(from);
        GDALRasterBand* out = ortho->GetRasterBand(i);
        out->SetDescription(in->GetDescription());
        out->SetColorInterpretation(in->GetColorInterpretation());
        if (char** items = in->GetMetadata())
            out->SetMetadata(items);
        int has = 0;
        const double sourceNoData = in->GetNoDataValue(&has);
        if (!std::isnan(noDataValue_))
            out->SetNoDataValue(noDataValue_);
        else if (has)
            out->SetNoDataValue(sourceNoData);
    }
    ortho.reset();
    if (errors.Failed()) {
        KESTREL_THROW(FileAccessException, orthoPath, FileAccessException::WriteFailed,
                      FormatString("The metadata of \"%s\" cannot be written: %s",
                                   orthoPath.c_str(), errors.Reason().c_str()));
    }
}

}  // namespace ortho
}  // namespace processes
}  // namespace kestrel
