#include <kestrel/crs.h>

#include <cmath>

#include <set>

#include <cpl_string.h>
#include <gdal_alg.h>
#include <ogr_spatialref.h>
#include <proj.h>

#include <kestrel/exception.h>

#include <kestrel/gdalsupport.h>

namespace kestrel {
namespace ogc {
namespace cs {

namespace {

std::unique_ptr<OGRSpatialReference> NewSpatialReference() {
    auto srs = std::make_unique<OGRSpatialReference>();
    srs->SetAxisMappingStrategy(OAMS_TRADITIONAL_GIS_ORDER);
    return srs;
}

}  // namespace

ICRS::ICRS(const std::string& definition) : srs_(NewSpatialReference()) {
    gdalsupport::EnsureRegistered();
    gdalsupport::ErrorCapture errors;
    if (definition.empty() || definition.find('\0') != std::string::npos ||
        srs_->SetFromUserInput(definition.c_str()) != OGRERR_NONE) {
        const std::string reason =
            errors.Reason("not an authority code (EPSG:32632), WKT, PROJ string or file that "
                          "holds one");
        KESTREL_THROW(DataException, FormatString("\"%s\" names no coordinate system: %s",
                                                  definition.c_str(), reason.c_str()));
    }
    srs_->SetAxisMappingStrategy(OAMS_TRADITIONAL_GIS_ORDER);
}

ICRS::ICRS(const OGRSpatialReference& srs) : srs_(srs.Clone()) {
    srs_->SetAxisMappingStrategy(OAMS_TRADITIONAL_GIS_ORDER);
}

ICRS::ICRS(const ICRS& other) : ICRS(*other.srs_) {}

ICRS& ICRS::operator=(const ICRS& other) {
    if (this != &other) {
        srs_.reset(other.srs_->Clone());
        srs_->SetAxisMappingStrategy(OAMS_TRADITIONAL_GIS_ORDER);
    }
    return *this;
}

ICRS::~ICRS() = default;

ICRS* ICRS::Clone() const {
    return new ICRS(*this);
}

std::string ICRS::GetName() const {
    const char* name = srs_->GetName();
    return name != nullptr ? name : "";
}

std::string ICRS::GetWKT() const {
    const char* options[] = {"FORMAT=WKT2_2019", "MULTILINE=NO", nullptr};
    char* text = nullptr;
    srs_->exportToWkt(&text, options);
    std::string wkt = text != nullptr ? text : "";
    CPLFree(text);
    return wkt;
}

bool ICRS::IsGeographic() const {
    return srs_->IsGeographic() != 0;
}
bool ICRS::IsProjected() const {
    return srs_->IsProjected() != 0;
}
bool ICRS::IsCompound() const {
    return srs_->IsCompound() != 0;
}
unsigned int ICRS::GetAxesCount() const {
    return static_cast<unsigned int>(srs_->GetAxesCount());
}

bool ICRS::IsSame(const ICRS& other) const {
    const char* options[] = {"IGNORE_DATA_AXIS_TO_SRS_AXIS_MAPPING=YES", nullptr};
    return srs_->IsSame(other.srs_.get(), options) != 0;
}

// ---------------------------------------------------------------------------------------------

GeocodingInfo::GeocodingInfo() : forward_{0, 1, 0, 0, 0, 1}, inverse_{0, 1, 0, 0, 0, 1} {}

GeocodingInfo::GeocodingInfo(const std::array<double, 6>& geoTransform) : forward_(geoTransform) {
    for (double g : forward_) {
        if (!std::isfinite(g))
            KESTREL_THROW(DataException, "A geotransform holds a value that is not finite");
    }
    if (!GDALInvGeoTransform(forward_.data(), inverse_.data())) {
        KESTREL_THROW(DataException,
                      FormatString("The geotransform (%.17g, %.17g, %.17g, %.17g, %.17g, %.17g) "
                                   "cannot be inverted",
                                   forward_[0], forward_[1], forward_[2], forward_[3], forward_[4],
                                   forward_[5]));
    }
}

GeocodingInfo GeocodingInfo::NorthUp(double left, double top, double pixelWidth,
                                     double pixelHeight) {
    return GeocodingInfo({left, pixelWidth, 0.0, top, 0.0, -pixelHeight});
}

double GeocodingInfo::GetPixelWidth() const {
    return std::hypot(forward_[1], forward_[4]);
}
double GeocodingInfo::GetPixelHeight() const {
    return std::hypot(forward_[2], forward_[5]);
}

void GeocodingInfo::PixelToGround(double pixel, double line, double& x, double& y) const {
    x = forward_[0] + pixel * forward_[1] + line * forward_[2];
    y = forward_[3] + pixel * forward_[4] + line * forward_[5];
}

void GeocodingInfo::GroundToPixel(double x, double y, double& pixel, double& line) const {
    pixel = inverse_[0] + x * inverse_[1] + y * inverse_[2];
    line = inverse_[3] + x * inverse_[4] + y * inverse_[5];
}

// ---------------------------------------------------------------------------------------------

struct CoordinateTransformation::Impl {
    std::unique_ptr<OGRCoordinateTransformation> transform;
};

namespace {

// PROJ's data directories as OGR uses them, separated by commas.
std::string SearchPaths() {
    const CPLStringList paths(OSRGetPROJSearchPaths());
    std::string text;
    for (int i = 0; i < paths.size(); ++i)
        text += (text.empty() ? "" : ", ") + std::string(paths[i]);
    return text;
}

// The grids that PROJ's operations from source to target need and PROJ cannot find, by their
// short names ("us_nga_egm96_15.tif"), separated by commas; empty when none is missing.
std::string MissingGrids(const OGRSpatialReference& source, const OGRSpatialReference& target) {
    const ICRS from(source), to(target);
    PJ_CONTEXT* ctx = proj_context_create();
    // PROJ would print its failures on standard error; the caller's exception tells them.
    proj_log_level(ctx, PJ_LOG_NONE);
    const CPLStringList paths(OSRGetPROJSearchPaths());
    proj_context_set_search_paths(ctx, paths.size(), paths.List());
    PJ* src = proj_create(ctx, from.GetWKT().c_str());
    PJ* dst = proj_create(ctx, to.GetWKT().c_str());
    PJ_OPERATION_FACTORY_CONTEXT* factory = proj_create_operation_factory_context(ctx, nullptr);
    PJ_OBJ_LIST* operations = nullptr;
    if (src != nullptr && dst != nullptr && factory != nullptr) {
        proj_operation_factory_context_set_grid_availability_use(ctx, factory,
                                                                 PROJ_GRID_AVAILABILITY_IGNORED);
        proj_operation_factory_context_set_spatial_criterion(
            ctx, factory, PROJ_SPATIAL_CRITERION_PARTIAL_INTERSECTION);
        operations = proj_create_operations(ctx, src, dst, factory);
    }
    std::set<std::string> missing;
    const int count = operations != nullptr ? proj_list_get_count(operations) : 0;
    for (int i = 0; i < count; ++i) {
        PJ* operation = proj_list_get(ctx, operations, i);
        const int grids = proj_coordoperation_get_grid_used_count(ctx, operation);
        for (int g = 0; g < grids; ++g) {
            const char* name = nullptr;
            int available = 1;
            if (proj_coordoperation_get_grid_used(ctx, operation, g, &name, nullptr, nullptr,
                                                  nullptr, nullptr, nullptr, &available) &&
                !available && name != nullptr && *name != '\0')
                missing.insert(name);
        }
        proj_destroy(operation);
    }
    proj_list_destroy(operations);
    proj_operation_factory_context_destroy(factory);
    proj_destroy(src);
    proj_destroy(dst);
    proj_context_destroy(ctx);
    std::string names;
    for (const auto& name : missing)
        names += (names.empty() ? "" : ", ") + name;
    return names;
}

std::unique_ptr<OGRCoordinateTransformation> CreateTransformation(
    const OGRSpatialReference& source, const OGRSpatialReference& target) {
    gdalsupport::EnsureRegistered();
    gdalsupport::ErrorCapture errors;
    OGRCoordinateTransformationOptions options;
    // A ballpark transformation silently drops a datum shift or a missing geoid grid: tens of
    // metres of error. Refuse it.
    options.SetBallparkAllowed(false);
    std::unique_ptr<OGRCoordinateTransformation> transform(
        OGRCreateCoordinateTransformation(&source, &target, options));
    if (!transform) {
        const ICRS from(source), to(target);
        const std::string grids = MissingGrids(source, target);
        if (!grids.empty()) {
            KESTREL_THROW(DataException,
                          FormatString("No transformation from \"%s\" to \"%s\": PROJ cannot find "
                                       "the grid %s in its data directories (%s), and a "
                                       "\"ballpark\" step without it would be wrong by metres",
                                       from.GetName().c_str(), to.GetName().c_str(), grids.c_str(),
                                       SearchPaths().c_str()));
        }
        KESTREL_THROW(
            DataException,
            FormatString("No transformation from \"%s\" to \"%s\" without a ballpark "
                         "step (is a datum or geoid grid missing?): %s",
                         from.GetName().c_str(), to.GetName().c_str(), errors.Reason().c_str()));
    }
    return transform;
}

}  // namespace

CoordinateTransformation::CoordinateTransformation(const ICRS& source, const ICRS& target)
    : impl_(std::make_unique<Impl>()) {
    impl_->transform =
        CreateTransformation(source.GetSpatialReference(), target.GetSpatialReference());
}

CoordinateTransformation::CoordinateTransformation(const CoordinateTransformation& other)
    : impl_(std::make_unique<Impl>()) {
    impl_->transform.reset(other.impl_->transform->Clone());
}

CoordinateTransformation::~CoordinateTransformation() = default;

bool CoordinateTransformation::Transform(std::size_t n, double* x, double* y, double* z) const {
    if (n == 0)
        return true;
    gdalsupport::ErrorCapture errors;
    std::unique_ptr<int[]> success(new int[n]);
    const bool all = impl_->transform->Transform(n, x, y, z, nullptr, success.get()) != 0;
    bool every = all;
    for (std::size_t i = 0; i < n; ++i) {
        const bool good = success[i] != 0 && std::isfinite(x[i]) && std::isfinite(y[i]) &&
                          (z == nullptr || std::isfinite(z[i]));
        if (!good) {
            x[i] = y[i] = NAN;
            if (z != nullptr)
                z[i] = NAN;
            every = false;
        }
    }
    return every;
}

}  // namespace cs
}  // namespace ogc

namespace ogc {
namespace utils {

cs::DatumType GetVerticalDatumType(const cs::ICRS* crs) {
    if (crs == nullptr)
        return cs::DatumEllipsoid;
    const OGRSpatialReference& srs = crs->GetSpatialReference();
    if (srs.IsVertical() || srs.IsCompound())
        return cs::DatumMSL;
    return cs::DatumEllipsoid;
}

VerticalReference GetVerticalReference(const cs::ICRS* crs) {
    VerticalReference reference;
    if (crs == nullptr)
        return reference;
    const OGRSpatialReference& srs = crs->GetSpatialReference();
    if (!srs.IsVertical() && !srs.IsCompound() && srs.GetAxesCount() != 3)
        return reference;
    reference.known = true;
    reference.datum = srs.IsVertical() || srs.IsCompound() ? cs::DatumMSL : cs::DatumEllipsoid;
    const char* unit = nullptr;
    double factor = 0.0;
    if (srs.IsVertical() || srs.IsCompound()) {
        factor = srs.GetTargetLinearUnits("VERT_CS", &unit);
        const char* name = srs.GetAttrValue("VERT_CS");
        reference.name = name != nullptr ? name : crs->GetName();
    } else {
        // The third axis of a geographic or projected 3-D system: the ellipsoidal height.
        OGRAxisOrientation orientation;
        srs.GetAxis(nullptr, 2, &orientation, &factor);
        reference.name = crs->GetName();
    }
    reference.metresPerUnit = factor > 0.0 && std::isfinite(factor) ? factor : 1.0;
    if (unit != nullptr && *unit != '\0' && !EQUAL(unit, "unknown"))
        reference.unit = unit;
    else
        reference.unit = reference.metresPerUnit == 1.0
                             ? "metre"
                             : FormatString("unit of %.10g m", reference.metresPerUnit);
    return reference;
}

cs::ICRS* MapunitsToCRS(const std::string& text) {
    return new cs::ICRS(text);
}

}  // namespace utils
}  // namespace ogc
}  // namespace kestrel
