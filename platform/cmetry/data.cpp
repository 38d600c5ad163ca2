#include "klume/cmetry/data.h"

#include <algorithm>
#include <cmath>
#include <utility>

#include "objects.h"

namespace klume {
namespace cmetry {

IIlluminant::~IIlluminant() = default;
IObserver::~IObserver() = default;
IDensityStandard::~IDensityStandard() = default;

double IIlluminant::GetPower(double nm) const {
    const std::vector<double>& x = GetWavelengths();
    const std::vector<double>& y = GetPowers();
    if (nm <= x.front()) return y.front();
    if (nm >= x.back()) return y.back();
    // First point above nm; x[j - 1] <= nm < x[j].
    const std::size_t j =
        static_cast<std::size_t>(std::upper_bound(x.begin(), x.end(), nm) - x.begin());
    const double slope = (y[j] - y[j - 1]) / (x[j] - x[j - 1]);
    return slope * (nm - x[j - 1]) + y[j - 1];
}

namespace {

class TableIlluminant final : public IIlluminant {
  public:
    TableIlluminant(std::string name, std::string description, std::vector<double> wavelengths,
                    std::vector<double> powers)
        : amName(std::move(name)),
          amDescription(std::move(description)),
          amWavelengths(std::move(wavelengths)),
          amPowers(std::move(powers)) {}

    const std::string& GetName() const override { return amName; }
    const std::string& GetDescription() const override { return amDescription; }
    const std::vector<double>& GetWavelengths() const override { return amWavelengths; }
    const std::vector<double>& GetPowers() const override { return amPowers; }

  private:
    std::string amName;
    std::string amDescription;
    std::vector<double> amWavelengths;
    std::vector<double> amPowers;
};

class TableObserver final : public IObserver {
  public:
    TableObserver(std::string name, std::string description, int fieldSize, int first,
                  std::vector<double> cmf[3])
        : amName(std::move(name)),
          amDescription(std::move(description)),
          amFieldSize(fieldSize),
          amFirst(first) {
        for (int c = 0; c < 3; ++c) amCmf[c] = std::move(cmf[c]);
    }

    const std::string& GetName() const override { return amName; }
    const std::string& GetDescription() const override { return amDescription; }
    int GetFieldSize() const override { return amFieldSize; }
    int GetFirstWavelength() const override { return amFirst; }
    int GetSampleCount() const override { return static_cast<int>(amCmf[0].size()); }
    const double* GetCMF(int channel) const override { return amCmf[channel].data(); }

  private:
    std::string amName;
    std::string amDescription;
    int amFieldSize = 2;
    int amFirst = 360;
    std::vector<double> amCmf[3];
};

class ProductDensityStandard final : public IDensityStandard {
  public:
    ProductDensityStandard(std::string name, std::vector<std::string> channelNames,
                           std::vector<SampleTable> products)
        : amName(std::move(name)),
          amChannelNames(std::move(channelNames)),
          amProducts(std::move(products)) {}

    const std::string& GetName() const override { return amName; }
    int GetChannelCount() const override { return static_cast<int>(amProducts.size()); }
    const std::string& GetChannelName(int channel) const override {
        return amChannelNames[channel];
    }
    const SampleTable& GetProducts(int channel) const override { return amProducts[channel]; }

  private:
    std::string amName;
    std::vector<std::string> amChannelNames;
    std::vector<SampleTable> amProducts;
};

bool SetError(std::string* error, const std::string& text) {
    if (error != nullptr) *error = text;
    return false;
}

// The range over which weights are computed (ASTM E308 practice range); an
// illuminant must have power somewhere in it.
constexpr int kPowerRangeStart = 360;
constexpr int kPowerRangeEnd = 780;

// Log10 products above this are not spectral products (peak 5.000).
constexpr double kMaxLogProduct = 10.0;
// A channel whose largest linear product on the grid is below this (log10
// product -1, six decades under the peak) has no response there; ArgyllCMS's
// "no response" placeholder -10 lies far below.
constexpr double kMinPeakProduct = 1e-6;

}  // namespace

boost::shared_ptr<IIlluminant> MakeIlluminant(const std::string& name,
                                              const std::string& description,
                                              std::vector<double> wavelengths,
                                              std::vector<double> powers, std::string* error) {
    if (name.empty()) {
        SetError(error, "illuminant without a name");
        return {};
    }
    if (wavelengths.size() != powers.size() || wavelengths.size() < 2) {
        SetError(error, name + ": needs at least two wavelengths, each with one value");
        return {};
    }
    for (std::size_t i = 0; i < wavelengths.size(); ++i) {
        if (!std::isfinite(wavelengths[i]) || !std::isfinite(powers[i]) ||
            (i > 0 && !(wavelengths[i] > wavelengths[i - 1]))) {
            SetError(error, name + ": wavelengths must ascend strictly and values be finite");
            return {};
        }
        if (powers[i] < 0.0) {
            SetError(error, name + ": negative power at " + std::to_string(wavelengths[i]) + " nm");
            return {};
        }
    }
    boost::shared_ptr<IIlluminant> illuminant(
        new TableIlluminant(name, description, std::move(wavelengths), std::move(powers)));
    bool lit = false;
    for (int nm = kPowerRangeStart; nm <= kPowerRangeEnd && !lit; ++nm) {
        lit = illuminant->GetPower(nm) > 0.0;
    }
    if (!lit) {
        SetError(error, name + ": no power between 360 and 780 nm");
        return {};
    }
    return illuminant;
}

namespace detail {

boost::shared_ptr<IObserver> MakeObserver(const embedded::EmbeddedTable& table,
                                          const std::string& description, int fieldSize) {
    std::vector<double> cmf[3];
    for (int row = 0; row < table.rows; ++row) {
        for (int c = 0; c < 3; ++c) cmf[c].push_back(table.values[row * table.columns + 1 + c]);
    }
    const int first = static_cast<int>(table.values[0]);
    return boost::shared_ptr<IObserver>(
        new TableObserver(table.key, description, fieldSize, first, cmf));
}

boost::shared_ptr<IDensityStandard> MakeDensityStandard(
    const std::string& name, const std::vector<std::string>& channelNames,
    const std::vector<double>& wavelengths, const std::vector<std::vector<double>>& logProducts,
    std::string& error) {
    std::vector<SampleTable> products(logProducts.size(), SampleTable{});
    for (std::size_t row = 0; row < wavelengths.size(); ++row) {
        const double nm = wavelengths[row];
        if (nm < kFirstWavelength || nm > kLastWavelength) continue;
        const double offset = (nm - kFirstWavelength) / kWavelengthStep;
        const double index = std::round(offset);
        if (std::fabs(offset - index) > 1e-9) {
            error = name + ": wavelength " + std::to_string(nm) + " is off the 10 nm grid";
            return {};
        }
        for (std::size_t c = 0; c < logProducts.size(); ++c) {
            const double p = logProducts[c][row];
            if (p > kMaxLogProduct) {
                error = name + ": log10 product " + std::to_string(p) + " above " +
                        std::to_string(kMaxLogProduct);
                return {};
            }
            products[c][static_cast<std::size_t>(index)] = std::pow(10.0, p - 5.0);
        }
    }
    for (std::size_t c = 0; c < products.size(); ++c) {
        double peak = 0.0;
        for (double v : products[c]) peak = std::max(peak, v);
        if (!(peak >= kMinPeakProduct)) {
            error = name + ": channel " + channelNames[c] + " has no response on 380..730 nm";
            return {};
        }
    }
    return boost::shared_ptr<IDensityStandard>(
        new ProductDensityStandard(name, channelNames, std::move(products)));
}

}  // namespace detail
}  // namespace cmetry
}  // namespace klume
