// Chromatic adaptation transforms; see nxbase/adaptation.h.
#include "nxbase/adaptation.h"

#include <strings.h>

#include <charconv>
#include <cmath>
#include <stdexcept>
#include <string>

#include "nxbase/colorbatch.h"
#include "nxbase/colorvector.h"

namespace nxbase {
namespace {

constexpr Matrix3 kIdentity = {{{1.0, 0.0, 0.0}, {0.0, 1.0, 0.0}, {0.0, 0.0, 1.0}}};
// Hunt-Pointer-Estevez, normalised to equal-energy white.
constexpr Matrix3 kVonKries = {
    {{0.40024, 0.70760, -0.08081}, {-0.22630, 1.16532, 0.04570}, {0.0, 0.0, 0.91822}}};
constexpr Matrix3 kBradford = {
    {{0.8951, 0.2664, -0.1614}, {-0.7502, 1.7135, 0.0367}, {0.0389, -0.0685, 1.0296}}};
constexpr Matrix3 kCat02 = {
    {{0.7328, 0.4296, -0.1624}, {-0.7036, 1.6975, 0.0061}, {0.0030, 0.0136, 0.9834}}};

Matrix3 Multiply(const Matrix3& a, const Matrix3& b) {
    Matrix3 product{};
    for (int i = 0; i < 3; ++i) {
        for (int j = 0; j < 3; ++j) {
            for (int k = 0; k < 3; ++k) product[i][j] += a[i][k] * b[k][j];
        }
    }
    return product;
}

}  // namespace

bool ParseAdaptationMethod(const char* pName, AdaptationMethod* pMethod) {
    struct Entry {
        const char* name;
        AdaptationMethod method;
    };
    static const Entry kNames[] = {
        {"xyz", AdaptationMethod::kXYZScaling},    {"scaling", AdaptationMethod::kXYZScaling},
        {"vonkries", AdaptationMethod::kVonKries}, {"von-kries", AdaptationMethod::kVonKries},
        {"bradford", AdaptationMethod::kBradford}, {"cat02", AdaptationMethod::kCat02}};
    for (const Entry& entry : kNames) {
        if (pName && strcasecmp(pName, entry.name) == 0) {
            *pMethod = entry.method;
            return true;
        }
    }
    return false;
}

Matrix3 ConeResponseMatrix(AdaptationMethod axMethod) {
    switch (axMethod) {
        case AdaptationMethod::kXYZScaling:
            return kIdentity;
        case AdaptationMethod::kVonKries:
            return kVonKries;
        case AdaptationMethod::kBradford:
            return kBradford;
        case AdaptationMethod::kCat02:
            return kCat02;
    }
    return kIdentity;
}

Tristimulus Apply(const Matrix3& axMatrix, const Tristimulus& axXYZ) {
    Tristimulus out{};
    for (int i = 0; i < 3; ++i) {
        out[i] = axMatrix[i][0] * axXYZ[0] + axMatrix[i][1] * axXYZ[1] + axMatrix[i][2] * axXYZ[2];
    }
    return out;
}

Matrix3 Invert(const Matrix3& m) {
    // Adjugate over determinant; the matrices here are far from singular.
    Matrix3 inverse{};
    inverse[0][0] = m[1][1] * m[2][2] - m[1][2] * m[2][1];
    inverse[0][1] = m[0][2] * m[2][1] - m[0][1] * m[2][2];
    inverse[0][2] = m[0][1] * m[1][2] - m[0][2] * m[1][1];
    inverse[1][0] = m[1][2] * m[2][0] - m[1][0] * m[2][2];
    inverse[1][1] = m[0][0] * m[2][2] - m[0][2] * m[2][0];
    inverse[1][2] = m[0][2] * m[1][0] - m[0][0] * m[1][2];
    inverse[2][0] = m[1][0] * m[2][1] - m[1][1] * m[2][0];
    inverse[2][1] = m[0][1] * m[2][0] - m[0][0] * m[2][1];
    inverse[2][2] = m[0][0] * m[1][1] - m[0][1] * m[1][0];
    const double det = m[0][0] * inverse[0][0] + m[0][1] * inverse[1][0] + m[0][2] * inverse[2][0];
    if (det == 0.0 || !std::isfinite(det)) throw std::invalid_argument("matrix is singular");
    for (auto& row : inverse) {
        for (double& value : row) value /= det;
    }
    return inverse;
}

namespace {

std::string Shown(const Tristimulus& axWhite) {
    std::string text;
    for (const double v : axWhite) {
        char digits[32];
        const auto result = std::to_chars(digits, digits + sizeof digits, v);
        text += (text.empty() ? "" : " ") + std::string(digits, result.ptr);
    }
    return text;
}

// The white scaled to Y = 1, so that whites given on different scales (Y = 1
// and Y = 100) adapt chromaticity only and keep the scale of the colour.
Tristimulus Normalised(const Tristimulus& axWhite) {
    for (const double v : axWhite) {
        if (!(v > 0.0 && std::isfinite(v))) {
            throw std::invalid_argument("white point " + Shown(axWhite) +
                                        " cannot be adapted: X, Y and Z must be above zero");
        }
    }
    return {axWhite[0] / axWhite[1], 1.0, axWhite[2] / axWhite[1]};
}

}  // namespace

Matrix3 AdaptationMatrix(const Tristimulus& axSource, const Tristimulus& axDestination,
                         AdaptationMethod axMethod) {
    const Matrix3 cone = ConeResponseMatrix(axMethod);
    const Tristimulus source = Apply(cone, Normalised(axSource));
    const Tristimulus destination = Apply(cone, Normalised(axDestination));
    Matrix3 gain{};
    for (int i = 0; i < 3; ++i) {
        gain[i][i] = destination[i] / source[i];
        if (source[i] == 0.0 || !std::isfinite(gain[i][i])) {
            throw std::invalid_argument("white point " + Shown(axSource) + " or " +
                                        Shown(axDestination) + " cannot be adapted");
        }
    }
    return Multiply(Invert(cone), Multiply(gain, cone));
}

Tristimulus WhitePointOf(const MeasuringCondition& axCondition) {
    const ColorBatch batch(axCondition);
    return {batch.WhitePoint(0), batch.WhitePoint(1), batch.WhitePoint(2)};
}

XYZVector Adapt(const XYZVector& axXYZ, const MeasuringCondition& axDestination,
                AdaptationMethod axMethod) {
    const Matrix3 matrix = AdaptationMatrix(WhitePointOf(axXYZ.GetMeasuringCondition()),
                                            WhitePointOf(axDestination), axMethod);
    const Tristimulus adapted = Apply(matrix, {axXYZ[0], axXYZ[1], axXYZ[2]});
    return XYZVector(static_cast<float>(adapted[0]), static_cast<float>(adapted[1]),
                     static_cast<float>(adapted[2]), axDestination);
}

}  // namespace nxbase
