// Out-of-line destructors and the shared helpers of the platform's interfaces.
#include <cmath>

#include <kestrel/datasources.h>
#include <kestrel/dem.h>
#include <kestrel/elevation.h>
#include <kestrel/mathmodel.h>

namespace kestrel {

namespace dem {
IElevationSource::~IElevationSource() = default;

bool IElevationSource::GetHeight(double x, double y, double& height) const {
    double h = NAN;
    GetHeights(1, &x, &y, &h);
    if (std::isnan(h))
        return false;
    height = h;
    return true;
}

bool IElevationSource::GetHeightRange(double, double, double, double, double&, double&) const {
    return false;
}

bool IRasterDEM::CountPosts(double, double, double, double, std::size_t&, std::size_t&) const {
    return false;
}
}  // namespace dem

namespace mathmodel {
IMathModel::~IMathModel() = default;
}

namespace datasources {
IDataset::~IDataset() = default;
}

}  // namespace kestrel
