// Colour functions over NumPy arrays, on the library's batch path.
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cctype>
#include <cerrno>
#include <cmath>
#include <cstdint>
#include <cstring>
#include <filesystem>
#include <limits>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <tuple>
#include <vector>

#include "common.h"
#include "klume/cmetry/repository.h"
#include "nxbase/adaptation.h"
#include "nxbase/colorbatch.h"
#include "nxbase/colorconverter.h"
#include "nxbase/colordiff.h"
#include "nxbase/colorvector.h"
#include "nxbase/finegrid.h"
#include "nxbase/meascond.h"
#include "nxbase/resample.h"
#include "nxbase/spectrafile.h"
#include "nxbase/strhelp.h"
#include "nxbase/thread.h"

namespace nxpy {
namespace {

constexpr py::ssize_t kBands = nxbase::kSpectrumSize;
// From this many spectra on the work is split over the cores, in parts of at
// least kMinPerThread (a thread costs about as much as that many spectra).
constexpr std::size_t kParallelFrom = 1 << 16;
constexpr std::size_t kMinPerThread = 16384;

using FloatArray = py::array_t<float, py::array::c_style | py::array::forcecast>;
using DoubleArray = py::array_t<double, py::array::c_style | py::array::forcecast>;

std::string ShapeText(const py::array& array) {
    std::string text = "(";
    for (py::ssize_t i = 0; i < array.ndim(); ++i) {
        text += (i ? ", " : "") + std::to_string(array.shape(i));
    }
    return text + (array.ndim() == 1 ? ",)" : ")");
}

// The argument as an array of numbers whose last axis has `size` entries.
py::array CheckedRows(const py::handle& object, py::ssize_t size, const char* what) {
    py::array any = py::array::ensure(object);
    if (!any) throw py::value_error(std::string(what) + " must be an array of numbers");
    if (any.dtype().kind() != 'f' && any.dtype().kind() != 'i' && any.dtype().kind() != 'u') {
        throw py::value_error(std::string(what) + " must hold numbers, not dtype " +
                              py::str(any.dtype()).cast<std::string>());
    }
    if (any.ndim() == 0 || any.shape(any.ndim() - 1) != size) {
        throw py::value_error(std::string(what) + " must have shape (..., " + std::to_string(size) +
                              "), got " + ShapeText(any));
    }
    return any;
}

// The argument as a C-contiguous float32 array whose last axis has `size`
// entries (copied only when it is not one already).
FloatArray AsFloatRows(const py::handle& object, py::ssize_t size, const char* what) {
    return FloatArray::ensure(CheckedRows(object, size, what));
}

// Spectra of 36 values as the batch reads them: contiguous float32 or
// float64 as given (the batch rounds doubles as it reads them), anything
// else copied once into float32.
struct SpectraRows {
    py::array array;  // holds the data
    const float* floats = nullptr;
    const double* doubles = nullptr;
    std::size_t count = 0;
};

SpectraRows AsSpectraRows(const py::handle& object) {
    SpectraRows rows;
    py::array any = CheckedRows(object, kBands, "spectra");
    if (py::isinstance<py::array_t<double, py::array::c_style>>(any)) {
        rows.array = any;
        rows.doubles = static_cast<const double*>(any.data());
    } else {
        const FloatArray floats = FloatArray::ensure(any);
        rows.array = floats;
        rows.floats = floats.data();
    }
    rows.count = static_cast<std::size_t>(rows.array.size() / kBands);
    return rows;
}

// threads=: None for the default (all cores for large arrays), else at
// least 1; 1 runs on the calling thread.
unsigned ThreadCount(const py::object& threads) {
    if (threads.is_none()) return 0;
    const long count = threads.cast<long>();
    if (count < 1)
        throw py::value_error("threads must be at least 1, got " + std::to_string(count));
    return static_cast<unsigned>(std::min<long>(count, 1024));
}

DoubleArray AsDoubleRows(const py::handle& object, py::ssize_t size, const char* what) {
    py::array any = py::array::ensure(object);
    if (!any || any.ndim() == 0 || any.shape(any.ndim() - 1) != size) {
        throw py::value_error(std::string(what) + " must have shape (..., " + std::to_string(size) +
                              "), got " + (any ? ShapeText(any) : std::string("no array")));
    }
    return DoubleArray::ensure(any);
}

// The shape of the result: the input's leading axes and `last`.
std::vector<py::ssize_t> ResultShape(const py::array& input, py::ssize_t last) {
    std::vector<py::ssize_t> shape(input.shape(), input.shape() + input.ndim() - 1);
    shape.push_back(last);
    return shape;
}

std::string ObserverName(const py::object& observer) {
    const std::string name = py::str(observer).cast<std::string>();
    if (name != "2" && name != "10")
        throw py::value_error("unknown observer \"" + name + "\"; use 2 or 10");
    return name;
}

std::string IlluminantName(const std::string& given) {
    const std::string name = klume::cmetry::IlluminantRepository::CanonicalName(given);
    std::string why;
    if (!klume::cmetry::IlluminantRepository::Find(name, &why)) {
        throw py::value_error(why.empty() ? "unknown illuminant \"" + given + "\"" : why);
    }
    return name;
}

MeasuringCondition Condition(const std::string& illuminant, const py::object& observer,
                             const std::string& density = "") {
    const ObserverClass observerClass{String(ObserverName(observer))};
    return MeasuringCondition(IllumClass(IlluminantName(illuminant)), observerClass,
                              density.empty() ? DStdClass() : DStdClass(density),
                              PhysicalConditions());
}

// Batches are kept per illuminant and observer: making one costs about as
// much as a few hundred spectra.
std::shared_ptr<const nxbase::ColorBatch> BatchFor(const std::string& illuminant,
                                                   const py::object& observer) {
    static std::mutex mutex;
    static std::map<std::pair<std::string, std::string>, std::shared_ptr<const nxbase::ColorBatch>>
        batches;
    const std::string name = IlluminantName(illuminant);
    const std::string observerName = ObserverName(observer);
    std::lock_guard<std::mutex> lock(mutex);
    auto& batch = batches[{name, observerName}];
    if (!batch) batch = std::make_shared<const nxbase::ColorBatch>(Condition(name, observer));
    return batch;
}

enum class Quantity { kXYZ, kLab };

// Spectra beyond this Y (percent of the white) are no reflectance factors:
// with every value at most 2 (the readers' bound) Y stays below 200.
constexpr float kMaxPlausibleY = 200.0f;
// L* of Y = 200 % of the white.
constexpr float kMaxPlausibleL = 130.2f;

typedef float Float4 __attribute__((vector_size(16)));
typedef std::int32_t Int4 __attribute__((vector_size(16)));

float LimitOf(Quantity quantity) {
    return quantity == Quantity::kXYZ ? kMaxPlausibleY : kMaxPlausibleL;
}

// The component the limit applies to: Y of XYZ, L* of Lab.
int LightOf(Quantity quantity) {
    return quantity == Quantity::kXYZ ? 1 : 0;
}

// True for a result that no reflectance factors give: a lightness beyond
// the limit (percentages, most likely), or a component that is NaN or
// infinite. The batch's BatchRange tells the same of many results at once.
inline bool Implausible(const float* v, int axis, float limit) {
    return !(v[axis] <= limit) || !std::isfinite(v[0]) || !std::isfinite(v[1]) ||
           !std::isfinite(v[2]);
}

// The index of the first implausible result; -1 when all are plausible.
// Each stretch is first tested as a whole, four results (twelve floats, three
// vectors) at a time against the limit where the tested component lies and
// the largest float elsewhere, and against the lowest float (a NaN fails
// both, an infinity one); only a stretch that fails is searched.
long FirstImplausible(const float* out, std::size_t count, Quantity quantity) {
    const int axis = LightOf(quantity);
    const float limit = LimitOf(quantity);
    float limitOf[12];
    for (int k = 0; k < 12; ++k)
        limitOf[k] = k % 3 == axis ? limit : std::numeric_limits<float>::max();
    Float4 limits[3];
    std::memcpy(limits, limitOf, sizeof limits);
    const float lowest = std::numeric_limits<float>::lowest();
    const Float4 lows = {lowest, lowest, lowest, lowest};
    constexpr std::size_t kStretch = 256;
    for (std::size_t begin = 0; begin < count; begin += kStretch) {
        const std::size_t end = std::min(count, begin + kStretch);
        Int4 within = {-1, -1, -1, -1};
        std::size_t i = begin;
        for (; i + 4 <= end; i += 4) {
            Float4 v0, v1, v2;
            std::memcpy(&v0, out + 3 * i, sizeof v0);
            std::memcpy(&v1, out + 3 * i + 4, sizeof v1);
            std::memcpy(&v2, out + 3 * i + 8, sizeof v2);
            within &= (v0 <= limits[0]) & (v1 <= limits[1]) & (v2 <= limits[2]) & (v0 >= lows) &
                      (v1 >= lows) & (v2 >= lows);
        }
        bool any = !(within[0] & within[1] & within[2] & within[3]);
        for (; i < end; ++i) any |= Implausible(out + 3 * i, axis, limit);
        if (!any) continue;
        for (i = begin; i < end; ++i) {
            if (Implausible(out + 3 * i, axis, limit)) return static_cast<long>(i);
        }
    }
    return -1;
}

// The first value of a spectrum that is not a finite number, or -1.
template <class T>
long FirstNonFinite(const T* values, std::size_t count) {
    for (std::size_t k = 0; k < count; ++k) {
        if (!std::isfinite(values[k])) return static_cast<long>(k);
    }
    return -1;
}

// Why spectrum `index` gave the implausible result `v`.
template <class T>
std::string ImplausibleReason(long index, const T* spectrum, std::size_t bands, const float* v,
                              Quantity quantity) {
    const long at = FirstNonFinite(spectrum, bands);
    if (at >= 0) {
        return "spectrum " + std::to_string(index) + " holds " +
               (std::isnan(spectrum[at]) ? "NaN" : "an infinity") + " (value " +
               std::to_string(at) + "): it has no colour";
    }
    const int axis = LightOf(quantity);
    const std::string name = quantity == Quantity::kXYZ ? "Y " : "L* ";
    if (!std::isfinite(v[axis]) || v[axis] <= LimitOf(quantity)) {
        return "spectrum " + std::to_string(index) +
               " gives a colour beyond the float range: not reflectance factors (white = 1)";
    }
    return "spectrum " + std::to_string(index) + " gives " + name +
           StringHelpers::Fixed(v[axis], 6) +
           ": not reflectance factors (white = 1); divide percentages by 100 first";
}

// Spectra converted and then checked at a time, so that a part with a bad
// spectrum stops early; a multiple of the batch kernel's sixteen, and large
// enough (1.5 MiB of results) that the batch writes them around the cache.
// The kernels' range clears almost every piece, so a piece's results are
// hardly ever read back.
constexpr std::size_t kCheckedPiece = 1 << 17;

// Spectra per call of a progress call-back: large enough that the call costs
// nothing against the work, small enough for a bar to move.
constexpr std::size_t kProgressChunk = 1 << 18;

// Runs work(begin, end) over [0, count) without the GIL. With a progress
// call-back, in chunks, calling progress(fraction done) with the GIL after
// each and 1.0 at the end; an exception from it stops the work.
template <class Work>
void RunWithProgress(std::size_t count, const py::object& progress, Work work) {
    if (progress.is_none()) {
        py::gil_scoped_release unlocked;
        work(std::size_t{0}, count);
        return;
    }
    for (std::size_t begin = 0; begin < count; begin += kProgressChunk) {
        const std::size_t end = std::min(count, begin + kProgressChunk);
        {
            py::gil_scoped_release unlocked;
            work(begin, end);
        }
        progress(static_cast<double>(end) / static_cast<double>(count));
    }
    if (count == 0) progress(1.0);
}

// Fine-grid weights are kept per illuminant, observer and grid, as batches are.
std::shared_ptr<const nxbase::FineGridTristimulus> FineGridFor(const std::string& illuminant,
                                                               const py::object& observer,
                                                               const std::vector<double>& grid) {
    static std::mutex mutex;
    static std::map<std::tuple<std::string, std::string, std::vector<double>>,
                    std::shared_ptr<const nxbase::FineGridTristimulus>>
        grids;
    const std::string name = IlluminantName(illuminant);
    const std::string observerName = ObserverName(observer);
    std::lock_guard<std::mutex> lock(mutex);
    auto& fine = grids[{name, observerName, grid}];
    if (!fine)
        fine = std::make_shared<const nxbase::FineGridTristimulus>(Condition(name, observer), grid);
    return fine;
}

// A grid spectra are given a colour on: it must cover the visible.
std::vector<double> GridOf(const py::object& wavelengths) {
    const DoubleArray grid = DoubleArray::ensure(py::array::ensure(wavelengths));
    if (!grid || grid.ndim() != 1) throw py::value_error("wavelengths must be one-dimensional");
    std::vector<double> values(grid.data(), grid.data() + grid.shape(0));
    const std::string problem = nxbase::VisibleCoverageProblem(values);
    if (!problem.empty()) throw py::value_error(problem);
    return values;
}

py::array_t<float> SpectraTo(Quantity quantity, const py::object& spectra,
                             const std::string& illuminant, const py::object& observer,
                             const py::object& wavelengths, const py::object& progress,
                             const py::object& threads = py::none());

// Spectra on their own grid: summed at its interval when it is finer than
// 10 nm, else brought onto the 36 points first.
py::array_t<float> SpectraOnGridTo(Quantity quantity, const py::object& spectra,
                                   const std::string& illuminant, const py::object& observer,
                                   const std::vector<double>& grid, const py::object& progress,
                                   unsigned threads) {
    const FloatArray input = AsFloatRows(spectra, static_cast<py::ssize_t>(grid.size()), "spectra");
    const std::size_t count =
        static_cast<std::size_t>(input.size() / static_cast<py::ssize_t>(grid.size()));
    if (!nxbase::FineGridTristimulus::Applies(grid)) {
        const nxbase::SpectralResampler resampler(grid);
        py::array_t<float> standard(ResultShape(input, kBands));
        {
            py::gil_scoped_release unlocked;
            resampler.ResampleMany(input.data(), count, standard.mutable_data());
        }
        return SpectraTo(quantity, standard, illuminant, observer, py::none(), progress,
                         threads ? py::cast(threads) : py::none());
    }
    const auto fine = FineGridFor(illuminant, observer, grid);
    py::array_t<float> result(ResultShape(input, 3));
    float* out = result.mutable_data();
    const float* in = input.data();
    const std::size_t bands = grid.size();
    RunWithProgress(count, progress, [&](std::size_t begin, std::size_t end) {
        const std::size_t n = end - begin;
        const unsigned parts = threads ? threads : (n >= kParallelFrom ? 0u : 1u);
        quantity == Quantity::kXYZ
            ? fine->ToXYZParallel(in + begin * bands, n, out + 3 * begin, parts)
            : fine->ToLabParallel(in + begin * bands, n, out + 3 * begin, parts);
    });
    const long implausible = FirstImplausible(out, count, quantity);
    if (implausible >= 0) {
        throw py::value_error(ImplausibleReason(implausible, in + implausible * bands, bands,
                                                out + 3 * implausible, quantity));
    }
    return result;
}

py::array_t<float> SpectraTo(Quantity quantity, const py::object& spectra,
                             const std::string& illuminant, const py::object& observer,
                             const py::object& wavelengths, const py::object& progress,
                             const py::object& threadsWanted) {
    const unsigned threads = ThreadCount(threadsWanted);
    if (!wavelengths.is_none()) {
        return SpectraOnGridTo(quantity, spectra, illuminant, observer, GridOf(wavelengths),
                               progress, threads);
    }
    const SpectraRows input = AsSpectraRows(spectra);
    const auto batch = BatchFor(illuminant, observer);
    py::array_t<float> result(ResultShape(input.array, 3));
    const std::size_t count = input.count;
    float* out = result.mutable_data();
    // Each part is converted and checked by the thread that wrote it, a
    // piece at a time.
    std::atomic<long> implausible{-1};
    const auto convert = [&](const auto* in, std::size_t first, std::size_t n) {
        long bad = -1;
        for (std::size_t done = 0; done < n && bad < 0; done += kCheckedPiece) {
            const std::size_t piece = std::min(kCheckedPiece, n - done);
            float* to = out + 3 * (first + done);
            const auto* from = in + (first + done) * kBands;
            const nxbase::BatchRange range = quantity == Quantity::kXYZ
                                                 ? batch->ToXYZ(from, piece, to)
                                                 : batch->ToLab(from, piece, to);
            // What the kernels saw in passing clears most pieces; only a
            // piece with a result beyond the limit or not finite is searched.
            bad = range.allFinite && range.brightest <= LimitOf(quantity)
                      ? -1
                      : FirstImplausible(to, piece, quantity);
            if (bad >= 0) bad += static_cast<long>(first + done);
        }
        long seen = implausible.load();
        while (bad >= 0 && (seen < 0 || seen > bad) &&
               !implausible.compare_exchange_weak(seen, bad)) {
        }
    };
    RunWithProgress(count, progress, [&](std::size_t begin, std::size_t end) {
        const std::size_t n = end - begin;
        const unsigned parts = threads ? threads : (n >= kParallelFrom ? 0u : 1u);
        nxbase::RunInParts(n, parts, kMinPerThread, 16, [&](std::size_t first, std::size_t count) {
            input.doubles ? convert(input.doubles, begin + first, count)
                          : convert(input.floats, begin + first, count);
        });
    });
    if (implausible >= 0) {
        const long i = implausible.load();
        const float* v = out + 3 * i;
        throw py::value_error(
            input.doubles ? ImplausibleReason(i, input.doubles + i * kBands, kBands, v, quantity)
                          : ImplausibleReason(i, input.floats + i * kBands, kBands, v, quantity));
    }
    return result;
}

py::array_t<float> SpectraToLCh(const py::object& spectra, const std::string& illuminant,
                                const py::object& observer, const py::object& progress,
                                const py::object& threads) {
    py::array_t<float> lab =
        SpectraTo(Quantity::kLab, spectra, illuminant, observer, py::none(), progress, threads);
    const MeasuringCondition condition = Condition(illuminant, observer);
    float* v = lab.mutable_data();
    const std::size_t count = static_cast<std::size_t>(lab.size() / 3);
    py::gil_scoped_release unlocked;
    for (std::size_t i = 0; i < count; ++i, v += 3) {
        const LChVector lch{LABVector(v[0], v[1], v[2], condition)};
        v[2] = static_cast<float>(nxbase::HueOfComputedLab(v[1], v[2]));
        v[1] = lch[1];
    }
    return lab;
}

py::array_t<float> SpectraToDin99(const py::object& spectra, const std::string& illuminant,
                                  const py::object& observer, const py::object& progress,
                                  const py::object& threads) {
    py::array_t<float> lab =
        SpectraTo(Quantity::kLab, spectra, illuminant, observer, py::none(), progress, threads);
    float* v = lab.mutable_data();
    const std::size_t count = static_cast<std::size_t>(lab.size() / 3);
    py::gil_scoped_release unlocked;
    nxbase::LabToDin99(v, v, count);
    return lab;
}

py::array_t<float> SpectraToDensity(const py::object& spectra, const std::string& standard) {
    std::string why;
    if (!klume::cmetry::DensityStandardRepository::Find(standard, &why)) {
        throw py::value_error(why.empty() ? "unknown density standard \"" + standard + "\"" : why);
    }
    const FloatArray input = AsFloatRows(spectra, kBands, "spectra");
    py::array_t<float> result(ResultShape(input, 3));
    const DichteFilter filter{DStdClass(standard)};
    const std::size_t count = static_cast<std::size_t>(input.size() / kBands);
    const float* in = input.data();
    float* out = result.mutable_data();
    py::gil_scoped_release unlocked;
    for (std::size_t i = 0; i < count; ++i) {
        const ReflectanceSpectrum spectrum(in + i * kBands, PhysicalConditions());
        for (unsigned short c = 0; c < 3; ++c) {
            out[3 * i + c] = std::nanf("");
            filter.GetDensity(spectrum, c, out[3 * i + c]);
        }
    }
    return result;
}

py::array_t<float> LabToSRGB(const py::object& lab) {
    const FloatArray input = AsFloatRows(lab, 3, "lab");
    py::array_t<float> result(ResultShape(input, 3));
    const std::size_t count = static_cast<std::size_t>(input.size() / 3);
    const float* in = input.data();
    float* out = result.mutable_data();
    py::gil_scoped_release unlocked;
    nxbase::LabToScreenRGB(in, out, count);
    return result;
}

py::array_t<double> DeltaE(const py::object& reference, const py::object& sample,
                           const std::string& method) {
    nxbase::DeltaEMethod chosen{};
    if (!nxbase::ParseDeltaEMethod(method.c_str(), &chosen)) {
        throw py::value_error(
            "unknown method \"" + method +
            "\"; use 2000, 94, 94t, cmc, cmc11 or ab (or \"CIE 2000\", \"CIE 1994\", \"CMC\", "
            "\"CIE 1976\")");
    }
    AsDoubleRows(reference, 3, "lab1");
    AsDoubleRows(sample, 3, "lab2");
    // NumPy broadcasting of the leading axes.
    const py::module_ numpy = py::module_::import("numpy");
    const py::tuple both =
        numpy.attr("broadcast_arrays")(py::array::ensure(reference), py::array::ensure(sample));
    const DoubleArray a = DoubleArray::ensure(both[0]);
    const DoubleArray b = DoubleArray::ensure(both[1]);
    py::array_t<double> result(std::vector<py::ssize_t>(a.shape(), a.shape() + a.ndim() - 1));
    const std::size_t count = static_cast<std::size_t>(a.size() / 3);
    const double* p = a.data();
    const double* q = b.data();
    double* out = result.mutable_data();
    py::gil_scoped_release unlocked;
    for (std::size_t i = 0; i < count; ++i) {
        out[i] = nxbase::DeltaE({p[3 * i], p[3 * i + 1], p[3 * i + 2]},
                                {q[3 * i], q[3 * i + 1], q[3 * i + 2]}, chosen);
    }
    return result;
}

// A white point: an illuminant name (with the observer) or XYZ values.
nxbase::Tristimulus WhiteOf(const py::object& white, const py::object& observer) {
    if (py::isinstance<py::str>(white)) {
        return nxbase::WhitePointOf(Condition(white.cast<std::string>(), observer));
    }
    const DoubleArray xyz = AsDoubleRows(white, 3, "white");
    if (xyz.ndim() != 1)
        throw py::value_error("white must be an illuminant name or one XYZ triple");
    const nxbase::Tristimulus w{xyz.data()[0], xyz.data()[1], xyz.data()[2]};
    for (const double v : w) {
        if (!(v > 0.0 && std::isfinite(v))) {
            throw py::value_error("white must have X, Y and Z above zero, got " +
                                  std::string(py::str(py::repr(white))));
        }
    }
    return w;
}

// Applies `convert` to each triple of a (..., 3) array, into float64.
template <class Convert>
py::array_t<double> MapTriples(const py::object& values, const char* what, Convert convert) {
    const DoubleArray input = AsDoubleRows(values, 3, what);
    py::array_t<double> result(ResultShape(input, 3));
    const std::size_t count = static_cast<std::size_t>(input.size() / 3);
    const double* in = input.data();
    double* out = result.mutable_data();
    py::gil_scoped_release unlocked;
    for (std::size_t i = 0; i < count; ++i) convert(in + 3 * i, out + 3 * i);
    return result;
}

py::array_t<double> XYZToLab(const py::object& xyz, const py::object& white,
                             const py::object& observer) {
    const nxbase::Tristimulus w = WhiteOf(white, observer);
    const DoubleArray input = AsDoubleRows(xyz, 3, "XYZ");
    py::array_t<double> result(ResultShape(input, 3));
    double* out = result.mutable_data();
    std::copy(input.data(), input.data() + input.size(), out);
    py::gil_scoped_release unlocked;
    // The whole array in one call: the same values as CielabOf of each.
    nxbase::CielabInPlace(out, static_cast<std::size_t>(input.size() / 3), w);
    return result;
}

py::array_t<double> LabToXYZ(const py::object& lab, const py::object& white,
                             const py::object& observer) {
    const nxbase::Tristimulus w = WhiteOf(white, observer);
    return MapTriples(lab, "Lab", [w](const double* v, double* out) {
        const std::array<double, 3> xyz = nxbase::XyzOfCielab({v[0], v[1], v[2]}, w);
        std::copy(xyz.begin(), xyz.end(), out);
    });
}

// LCh: h in degrees within (0, 360], grey (|a|, |b| below 0.001, beyond the
// float path's rounding) and an exact 0 degrees give 360.
py::array_t<double> LabToLCh(const py::object& lab) {
    return MapTriples(lab, "Lab", [](const double* v, double* out) {
        const bool finite = std::isfinite(v[0]) && std::isfinite(v[1]) && std::isfinite(v[2]);
        const double nan = std::numeric_limits<double>::quiet_NaN();
        out[0] = finite ? v[0] : nan;
        out[1] = finite ? std::hypot(v[1], v[2]) : nan;
        out[2] = finite ? nxbase::HueOfComputedLab(v[1], v[2]) : nan;
    });
}

// colour-science's method names as well as the library's.
nxbase::AdaptationMethod AdaptationMethodOf(const std::string& name) {
    std::string key;
    for (const char c : name) {
        if (c != ' ' && c != '_' && c != '-')
            key += static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    }
    if (key == "xyzscaling") key = "xyz";
    nxbase::AdaptationMethod method{};
    if (!nxbase::ParseAdaptationMethod(key.c_str(), &method)) {
        throw py::value_error("unknown method \"" + name +
                              "\"; use Bradford, CAT02, Von Kries or XYZ Scaling");
    }
    return method;
}

py::array_t<double> ChromaticAdaptation(const py::object& xyz, const py::object& source,
                                        const py::object& target, const std::string& method,
                                        const py::object& observer) {
    nxbase::Matrix3 m{};
    try {
        m = nxbase::AdaptationMatrix(WhiteOf(source, observer), WhiteOf(target, observer),
                                     AdaptationMethodOf(method));
    } catch (const std::invalid_argument& error) {
        throw py::value_error(error.what());
    }
    return MapTriples(xyz, "XYZ", [m](const double* v, double* out) {
        const nxbase::Tristimulus r = nxbase::Apply(m, {v[0], v[1], v[2]});
        std::copy(r.begin(), r.end(), out);
    });
}

py::array_t<double> Resample(const py::object& wavelengths, const py::object& values) {
    const DoubleArray grid = DoubleArray::ensure(py::array::ensure(wavelengths));
    if (!grid || grid.ndim() != 1) throw py::value_error("wavelengths must be one-dimensional");
    const DoubleArray input = AsDoubleRows(values, grid.shape(0), "values");
    const nxbase::SpectralResampler resampler(
        std::vector<double>(grid.data(), grid.data() + grid.shape(0)));
    py::array_t<double> result(ResultShape(input, kBands));
    const std::size_t count = static_cast<std::size_t>(input.size() / grid.shape(0));
    const double* in = input.data();
    double* out = result.mutable_data();
    py::gil_scoped_release unlocked;
    for (std::size_t i = 0; i < count; ++i)
        resampler.Resample(in + i * grid.shape(0), out + i * kBands);
    return result;
}

// Warning categories of spectral input, made when the module is loaded:
// SpectralDataWarning for rejected rows, and its subclass
// SpectralScaleWarning for a scale that was guessed.
PyObject* gDataWarning = nullptr;
PyObject* gScaleWarning = nullptr;

void Warn(PyObject* category, const std::string& message) {
    if (PyErr_WarnEx(category, message.c_str(), 1) != 0) throw py::error_already_set();
}

// A file that cannot be opened raises the OSError Python's open() would
// (FileNotFoundError, PermissionError, IsADirectoryError).
void RaiseIfUnopenable(const std::string& path) {
    if (path == "-") return;
    std::error_code ignored;
    int error = std::filesystem::is_directory(path, ignored) ? EISDIR : 0;
    if (error == 0) {
        const int fd =
            ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);  // a FIFO must not block
        if (fd < 0) error = errno;
        if (fd >= 0) ::close(fd);
    }
    if (error == 0) return;
    errno = error;
    PyErr_SetFromErrnoWithFilename(PyExc_OSError, path.c_str());
    throw py::error_already_set();
}

py::tuple ReadSpectra(const py::object& pathLike, const std::string& scale, bool native) {
    const std::string path =
        py::str(py::module_::import("os").attr("fspath")(pathLike)).cast<std::string>();
    nxbase::SpectralReadOptions options;
    options.percentChoice = "scale=\"percent\"";
    options.fractionChoice = "scale=\"fraction\"";
    if (scale == "percent") {
        options.scale = nxbase::SpectralScale::kPercent;
    } else if (scale == "fraction") {
        options.scale = nxbase::SpectralScale::kFraction;
    } else if (scale != "auto") {
        throw py::value_error("scale must be \"auto\", \"percent\" or \"fraction\"");
    }
    RaiseIfUnopenable(path);
    nxbase::SpectralSet set;
    nxbase::SpectraTable table;
    std::string error;
    bool read = false;
    {
        py::gil_scoped_release unlocked;
        read = nxbase::ReadSpectralFile(path, options, &set, &error);
        if (read) table = nxbase::ToStandardGrid(set);
    }
    if (!read) throw py::value_error(error);
    for (const std::string& message : table.errors) Warn(gDataWarning, message);
    if (!table.scaleNote.empty()) Warn(gScaleWarning, table.scaleNote);
    for (const std::string& assumption : table.assumptions) Warn(gDataWarning, assumption);
    py::list ids, names;
    const py::ssize_t bands =
        native ? static_cast<py::ssize_t>(table.sourceWavelengths.size()) : kBands;
    py::array_t<float> values(
        std::vector<py::ssize_t>{static_cast<py::ssize_t>(table.rows.size()), bands});
    float* out = values.mutable_data();
    // The table holds one row per sample of the set, in order.
    for (std::size_t r = 0; r < table.rows.size(); ++r) {
        const nxbase::SpectrumRow& row = table.rows[r];
        ids.append(row.sampleId.empty() ? row.id : row.sampleId);
        names.append(row.sampleName);
        if (native) {
            std::copy(set.samples[r].values.begin(), set.samples[r].values.end(), out);
        } else {
            std::copy(row.values.begin(), row.values.end(), out);
        }
        out += bands;
    }
    if (!native) return py::make_tuple(ids, names, values);
    py::array_t<double> grid(static_cast<py::ssize_t>(table.sourceWavelengths.size()));
    std::copy(table.sourceWavelengths.begin(), table.sourceWavelengths.end(), grid.mutable_data());
    return py::make_tuple(ids, names, values, grid);
}

const char kSpectraDoc[] =
    "spectra: reflectance factors (white = 1) of shape (..., 36), 380..730 nm in 10 nm steps; "
    "float32 or float64 (float64 is rounded to float32 as it is read, as the batch path works in "
    "single "
    "precision; contiguous float32 and float64 are not copied), contiguous or not. illuminant: a "
    "built-in name (A, C, D50, D55, D65, D75, E, "
    "FL1..FL12, any case) or one installed in $NXBASE_DATA_DIR; observer: 2 or 10. Returns float32 "
    "of shape (..., 3). A spectrum whose Y would exceed twice the white (percentages, most likely) "
    "raises ValueError. progress: a call-back taking the fraction done (0..1], called every 262144 "
    "spectra and at the end (for tqdm: lambda f: bar.update(...)); the GIL is released between "
    "calls. "
    "threads: None (all cores from 65536 spectra on, else the calling thread) or a count; 1 runs "
    "on the "
    "calling thread. ";

const char kGridDoc[] =
    "wavelengths: the spectra's own grid (shape (N,), spectra (..., N)) instead of the 36 points: "
    "a "
    "regular grid finer than 10 nm (1 nm, 5 nm) is summed at its own interval "
    "(nxbase::FineGridTristimulus, "
    "CIE 15), any other is brought onto the 36 points first. ";

}  // namespace

void RegisterColour(py::module_& m) {
    const py::object two = py::int_(2);
    gDataWarning = PyErr_NewExceptionWithDoc("nxbase.SpectralDataWarning",
                                             "Spectra of a file that were rejected (read_spectra).",
                                             PyExc_UserWarning, nullptr);
    gScaleWarning =
        PyErr_NewExceptionWithDoc("nxbase.SpectralScaleWarning",
                                  "read_spectra guessed whether a file holds percentages or "
                                  "reflectance factors; the message says which and why.",
                                  gDataWarning, nullptr);
    if (gDataWarning == nullptr || gScaleWarning == nullptr) throw py::error_already_set();
    m.attr("SpectralDataWarning") = py::handle(gDataWarning);
    m.attr("SpectralScaleWarning") = py::handle(gScaleWarning);
    m.def(
        "spectra_to_XYZ",
        [](const py::object& s, const std::string& i, const py::object& o, const py::object& w,
           const py::object& p,
           const py::object& t) { return SpectraTo(Quantity::kXYZ, s, i, o, w, p, t); },
        py::arg("spectra"), py::arg("illuminant") = "D50", py::arg("observer") = two,
        py::arg("wavelengths") = py::none(), py::arg("progress") = py::none(),
        py::arg("threads") = py::none(),
        (std::string("CIE XYZ (white Y = 100), equal to nxbase::ColorBatch::ToXYZ. ") +
         kSpectraDoc + kGridDoc)
            .c_str());
    m.def(
        "spectra_to_Lab",
        [](const py::object& s, const std::string& i, const py::object& o, const py::object& w,
           const py::object& p,
           const py::object& t) { return SpectraTo(Quantity::kLab, s, i, o, w, p, t); },
        py::arg("spectra"), py::arg("illuminant") = "D50", py::arg("observer") = two,
        py::arg("wavelengths") = py::none(), py::arg("progress") = py::none(),
        py::arg("threads") = py::none(),
        (std::string("CIE 1976 L*a*b*, equal to nxbase::ColorBatch::ToLab. ") + kSpectraDoc +
         kGridDoc)
            .c_str());
    m.def("spectra_to_LCh", &SpectraToLCh, py::arg("spectra"), py::arg("illuminant") = "D50",
          py::arg("observer") = two, py::arg("progress") = py::none(),
          py::arg("threads") = py::none(),
          (std::string("L*, C*, h (degrees in (0, 360], grey 360) from the batch Lab. ") +
           kSpectraDoc)
              .c_str());
    m.def("spectra_to_DIN99", &SpectraToDin99, py::arg("spectra"), py::arg("illuminant") = "D50",
          py::arg("observer") = two, py::arg("progress") = py::none(),
          py::arg("threads") = py::none(),
          (std::string("DIN 6176 L99, a99, b99 from the batch Lab. ") + kSpectraDoc).c_str());
    m.def("spectra_to_density", &SpectraToDensity, py::arg("spectra"),
          py::arg("density_standard") = "Status E",
          "ISO 5-3 densities (red, green, blue filter) of spectra of shape (..., 36): \"Status "
          "A\", \"Status E\", "
          "\"Status M\", \"Status T\" or an installed standard; \"Status E\" by default, as "
          "everywhere in NxBase. NaN "
          "where nothing is reflected. float32 (..., 3).");
    m.def("Lab_to_sRGB", &LabToSRGB, py::arg("lab"),
          "Screen sRGB components 0..100 of CIE 1976 Lab values of shape (..., 3), by the formula "
          "path of "
          "nxbase::LabToScreenRGB (no ICC profile). float32 (..., 3).");
    m.def(
        "delta_E", &DeltaE, py::arg("lab1"), py::arg("lab2"), py::arg("method") = "2000",
        "Colour difference of Lab arrays of shape (..., 3), broadcast against each other; lab1 is "
        "the "
        "reference. method: \"2000\" (CIEDE2000), \"94\" (graphic arts), \"94t\" (textiles), "
        "\"cmc\" (2:1), "
        "\"cmc11\", \"ab\" (CIE76), or colour-science's \"CIE 2000\", \"CIE 1994\", \"CMC\" (2:1), "
        "\"CIE 1976\" (any case). float64 of the broadcast shape without the last axis.");
    const py::object d50 = py::str("D50");
    m.def("XYZ_to_Lab", &XYZToLab, py::arg("XYZ"), py::arg("white") = d50,
          py::arg("observer") = two,
          "CIE 1976 L*a*b* of XYZ (white Y = 100) of shape (..., 3). white: an illuminant name "
          "(its white point for the observer) or an XYZ triple with X, Y and Z above zero (else "
          "ValueError). The library's constants (t > 0.008856). A triple holding NaN or an "
          "infinity gives NaN. float64.");
    m.def("Lab_to_XYZ", &LabToXYZ, py::arg("Lab"), py::arg("white") = d50,
          py::arg("observer") = two, "The inverse of XYZ_to_Lab. float64 (..., 3).");
    m.def("Lab_to_LCh", &LabToLCh, py::arg("Lab"),
          "L, C*, h of Lab values (..., 3); h in degrees within (0, 360], grey (|a*|, |b*| below "
          "0.001, beyond the rounding of a grey's Lab in single precision) 360, as nxcolor "
          "prints. float64.");
    m.def("chromatic_adaptation", &ChromaticAdaptation, py::arg("XYZ"), py::arg("source"),
          py::arg("target"), py::arg("method") = "Bradford", py::arg("observer") = two,
          "XYZ seen under the source white as the corresponding colour under the target white, "
          "(..., 3). "
          "source, target: illuminant names or XYZ triples above zero, each on any scale (Y = 1 "
          "or 100: only their chromaticities count, the colour keeps its scale); method: "
          "\"Bradford\", \"CAT02\", \"Von "
          "Kries\" or "
          "\"XYZ Scaling\" (any case). float64.");
    m.def("resample", &Resample, py::arg("wavelengths"), py::arg("values"),
          "Spectra of shape (..., N) on the N increasing wavelengths onto 380..730 nm in 10 nm "
          "steps: the "
          "values themselves where the grid has the wavelength, Sprague interpolation on equal "
          "steps, linear "
          "on uneven ones, end values held outside the range. float64 (..., 36).");
    m.def(
        "read_spectra", &ReadSpectra, py::arg("path"), py::arg("scale") = "auto",
        py::arg("native") = false,
        "Reads a CSV or CGATS spectral file of any grid (as nxcolor does) and returns (ids, names, "
        "spectra) "
        "with spectra float32 of shape (N, 36). path: str or os.PathLike. Rejected rows, and what "
        "the reading assumed (end values held where the grid stops short of 380..730 nm, the id "
        "fields of a headerless file), become SpectralDataWarning; a scale that was guessed (the "
        "file does not say, scale=\"auto\") a "
        "SpectralScaleWarning saying which and why; an unreadable or unusable file, or one without "
        "spectra, raises ValueError (a file that cannot be opened the OSError open() raises, "
        "FileNotFoundError for a missing one); so does a file whose spectra disagree on the "
        "scale (some only percent explains, others fit reflectance factors) unless scale says "
        "which it holds. scale: \"auto\", \"percent\" or \"fraction\". native=True "
        "returns "
        "(ids, names, spectra, wavelengths) with the spectra as read, on the file's own grid, for "
        "spectra_to_XYZ/Lab(..., wavelengths=wavelengths).");
}

}  // namespace nxpy
