// The DEM factory: the slot of the installed implementation, the built-in implementation, and
// the unit factors of heights.
#include <kestrel/dem.h>

#include <cmath>
#include <utility>

#include <kestrel/exception.h>

#include "../factoryslot.h"
#include "constantdem.h"
#include "rasterdem.h"
#include "tileindex.h"

namespace kestrel {
namespace dem {

DEMFactoryImpl::~DEMFactoryImpl() = default;

namespace {

class BuiltInFactory final : public DEMFactoryImpl {
  public:
    bool IsTileRasterDEMFile(const std::string& path) override { return IsTileIndex(path); }

    IRasterDEM* CreateTileRasterDEM(const std::string& path) override {
        return OpenTileIndexDEM(path).release();
    }

    IRasterDEM* CreateFileRasterDEM(const std::string& path, unsigned int band, double offset,
                                    double scale, float noData, ogc::cs::DatumType datum,
                                    bool preload, int cacheMegabytes) override {
        RasterDEMOptions options;
        options.band = band;
        options.offset = offset;
        options.scale = scale;
        options.extraNoData = noData;
        options.datum = datum;
        options.preload = preload;
        options.cacheMegabytes = cacheMegabytes;
        return OpenRasterDEM(path, options).release();
    }

    IRasterDEM* CreateConstantDEMDownsampled(const ogc::cs::ICRS* crs,
                                             const ogc::cs::GeocodingInfo* geocoding,
                                             unsigned int width, unsigned int height,
                                             float constantHeight, ogc::cs::DatumType datum,
                                             float downsampling) override {
        return MakeConstantDEM(crs, geocoding, width, height, constantHeight, datum, downsampling)
            .release();
    }
};

FactorySlot<DEMFactoryImpl>& Slot() {
    static FactorySlot<DEMFactoryImpl> slot(std::make_shared<BuiltInFactory>());
    return slot;
}

std::shared_ptr<DEMFactoryImpl> Current() {
    return Slot().Current();
}

}  // namespace

bool DEMFactory::IsTileRasterDEMFile(const std::string& path) {
    return Current()->IsTileRasterDEMFile(path);
}

IRasterDEM* DEMFactory::CreateTileRasterDEM(const std::string& path) {
    return Current()->CreateTileRasterDEM(path);
}

IRasterDEM* DEMFactory::CreateFileRasterDEM(const std::string& path, unsigned int band,
                                            double offset, double scale, float noData,
                                            ogc::cs::DatumType datum, bool preload,
                                            int cacheMegabytes) {
    return Current()->CreateFileRasterDEM(path, band, offset, scale, noData, datum, preload,
                                          cacheMegabytes);
}

IRasterDEM* DEMFactory::CreateConstantDEMDownsampled(const ogc::cs::ICRS* crs,
                                                     const ogc::cs::GeocodingInfo* geocoding,
                                                     unsigned int width, unsigned int height,
                                                     float constantHeight, ogc::cs::DatumType datum,
                                                     float downsampling) {
    return Current()->CreateConstantDEMDownsampled(crs, geocoding, width, height, constantHeight,
                                                   datum, downsampling);
}

std::shared_ptr<DEMFactoryImpl> DEMFactory::GetDefaultImplementation() {
    return Slot().BuiltIn();
}

std::shared_ptr<DEMFactoryImpl> DEMFactory::SetImplementation(
    std::shared_ptr<DEMFactoryImpl> impl) {
    return Slot().Install(std::move(impl));
}

ScopedDEMFactoryImpl::ScopedDEMFactoryImpl(std::shared_ptr<DEMFactoryImpl> impl)
    : previous_(DEMFactory::SetImplementation(std::move(impl))) {}

ScopedDEMFactoryImpl::~ScopedDEMFactoryImpl() {
    DEMFactory::SetImplementation(std::move(previous_));
}

// ---------------------------------------------------------------------------------------------

double GetScale(const std::string& unit) {
    static const struct {
        const char* name;
        double factor;
    } units[] = {
        {"M", 1.0},
        {"METER", 1.0},
        {"METERS", 1.0},
        {"METRE", 1.0},
        {"METRES", 1.0},
        {"FT", 0.3048},
        {"FOOT", 0.3048},
        {"FEET", 0.3048},
        {"US_FOOT", 1200.0 / 3937.0},
        {"US_FEET", 1200.0 / 3937.0},
        {"USFT", 1200.0 / 3937.0},
        {"FTUS", 1200.0 / 3937.0},
        {"US_SURVEY_FOOT", 1200.0 / 3937.0},
        {"US_SURVEY_FEET", 1200.0 / 3937.0},
    };
    std::string known;
    for (const auto& u : units) {
        if (unit == u.name)
            return u.factor;
        known += known.empty() ? u.name : std::string(", ") + u.name;
    }
    KESTREL_THROW(DataException, FormatString("Unknown elevation unit \"%s\": known units are %s",
                                              unit.c_str(), known.c_str()));
}

}  // namespace dem
}  // namespace kestrel
