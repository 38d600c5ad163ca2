// LinAlg: the float and double routines share one template each.
#include "nxbase/linalg.h"

#include <cmath>
#include <utility>
#include <vector>

namespace {

template <typename T>
void InitVT(T* v, T k, int n) {
    for (int i = 0; i < n; ++i) v[i] = k;
}

template <typename T>
void CopyVectorT(T* d, const T* s, int n) {
    for (int i = 0; i < n; ++i) d[i] = s[i];
}

template <typename T>
void VAddVT(T* d, const T* a, const T* b, int n) {
    for (int i = 0; i < n; ++i) d[i] = a[i] + b[i];
}

template <typename T>
void VAddVT(T* d, const T* a, int n) {
    for (int i = 0; i < n; ++i) d[i] += a[i];
}

template <typename T>
void VSubVT(T* d, const T* a, const T* b, int n) {
    for (int i = 0; i < n; ++i) d[i] = a[i] - b[i];
}

template <typename T>
void VSubVT(T* d, const T* a, int n) {
    for (int i = 0; i < n; ++i) d[i] -= a[i];
}

template <typename T>
void VxVT(T* d, const T* a, const T* b, int n) {
    for (int i = 0; i < n; ++i) d[i] = a[i] * b[i];
}

template <typename T>
void VxVT(T* d, const T* a, int n) {
    for (int i = 0; i < n; ++i) d[i] *= a[i];
}

template <typename T>
void VdivVT(T* d, const T* a, const T* b, int n) {
    for (int i = 0; i < n; ++i) d[i] = a[i] / b[i];
}

template <typename T>
void VAddKxVT(T* d, T k, const T* a, int n) {
    for (int i = 0; i < n; ++i) d[i] += k * a[i];
}

template <typename T>
void KVAddKVT(T* d, T k1, const T* a, T k2, const T* b, int n) {
    for (int i = 0; i < n; ++i) d[i] = k1 * a[i] + k2 * b[i];
}

template <typename T>
void KxVT(T* d, T k, const T* a, int n) {
    for (int i = 0; i < n; ++i) d[i] = k * a[i];
}

template <typename T>
void KxVT(T* d, T k, int n) {
    for (int i = 0; i < n; ++i) d[i] *= k;
}

template <typename T>
T SumVT(const T* v, int n) {
    T s = 0;
    for (int i = 0; i < n; ++i) s += v[i];
    return s;
}

template <typename T>
T DotProdT(const T* a, const T* b, int n) {
    T s = 0;
    for (int i = 0; i < n; ++i) s += a[i] * b[i];
    return s;
}

template <typename T>
T BetragVT(const T* v, int n) {
    T s = 0;
    for (int i = 0; i < n; ++i) s += v[i] * v[i];
    return std::sqrt(s);
}

template <typename T>
void MxVT(T* r, const T* m, const T* v, int rows, int cols, int stride) {
    for (int i = 0; i < rows; ++i) r[i] = DotProdT(m + static_cast<long>(i) * stride, v, cols);
}

template <typename T>
void MtxVT(T* r, const T* m, const T* v, int rows, int cols) {
    for (int j = 0; j < cols; ++j) {
        T s = 0;
        for (int i = 0; i < rows; ++i) s += m[static_cast<long>(i) * cols + j] * v[i];
        r[j] = s;
    }
}

template <typename T>
void MxMT(T* c, const T* a, const T* b, int n, int m, int p) {
    for (int i = 0; i < n; ++i) {
        for (int j = 0; j < p; ++j) {
            T s = 0;
            for (int k = 0; k < m; ++k)
                s += a[static_cast<long>(i) * m + k] * b[static_cast<long>(k) * p + j];
            c[static_cast<long>(i) * p + j] = s;
        }
    }
}

template <typename T>
void TranspMT(T* t, const T* m, int rows, int cols) {
    for (int i = 0; i < rows; ++i) {
        for (int j = 0; j < cols; ++j)
            t[static_cast<long>(j) * rows + i] = m[static_cast<long>(i) * cols + j];
    }
}

template <typename T>
void MaTxMaT(const T* a, int rows, int cols, T* n) {
    for (int i = 0; i < cols; ++i) {
        for (int j = i; j < cols; ++j) {
            T s = 0;
            for (int k = 0; k < rows; ++k) {
                const T* row = a + static_cast<long>(k) * cols;
                s += row[i] * row[j];
            }
            n[static_cast<long>(i) * cols + j] = s;
            n[static_cast<long>(j) * cols + i] = s;
        }
    }
}

// Row-pivoted elimination; see the header for the pivot and singular rules.
template <typename T>
void GaussElT(T* b, T* a, T* x, int n, int& singular, int* rowStart, int* rowIndex) {
    singular = 0;
    for (int i = 0; i < n; ++i) {
        rowStart[i] = i * n;
        rowIndex[i] = i;
    }
    for (int k = 0; k < n; ++k) {
        int p = k;
        for (int i = k + 1; i < n; ++i) {
            if (std::fabs(a[rowStart[i] + k]) > std::fabs(a[rowStart[p] + k])) p = i;
        }
        if (a[rowStart[p] + k] == T(0)) {
            singular = 1;
            return;
        }
        std::swap(rowStart[k], rowStart[p]);
        std::swap(rowIndex[k], rowIndex[p]);
        const T* pivotRow = a + rowStart[k];
        for (int i = k + 1; i < n; ++i) {
            T* row = a + rowStart[i];
            const T f = -row[k] / pivotRow[k];
            for (int j = k + 1; j < n; ++j) row[j] += f * pivotRow[j];
            b[rowIndex[i]] += f * b[rowIndex[k]];
        }
    }
    for (int i = n - 1; i >= 0; --i) {
        const T* row = a + rowStart[i];
        T sum = 0;
        for (int j = i + 1; j < n; ++j) sum += x[j] * row[j];
        x[i] = (b[rowIndex[i]] - sum) / row[i];
    }
}

template <typename T>
void GaussElT(T* b, T* a, T* x, int n, int& singular) {
    constexpr int kOnStack = 16;  // small systems need no heap
    if (n <= kOnStack) {
        int rowStart[kOnStack];
        int rowIndex[kOnStack];
        GaussElT(b, a, x, n, singular, rowStart, rowIndex);
        return;
    }
    std::vector<int> rowStart(n);
    std::vector<int> rowIndex(n);
    GaussElT(b, a, x, n, singular, rowStart.data(), rowIndex.data());
}

template <typename T>
void LeastSquareFitT(T* w, T* y, T* a, T* x, int m, int n, T* nm, T* r, int* rowStart,
                     int* rowIndex, int& ok) {
    ok = 1;
    if (m < n) {
        ok = 0;
        return;
    }
    int singular = 0;
    if (m == n) {
        GaussElT(y, a, x, n, singular, rowStart, rowIndex);
    } else {
        for (int i = 0; i < m; ++i) KxVT(a + static_cast<long>(i) * n, w[i], n);
        MaTxMaT(a, m, n, nm);
        VxVT(y, w, m);
        MtxVT(r, a, y, m, n);
        GaussElT(r, nm, x, n, singular, rowStart, rowIndex);
    }
    if (singular) ok = 0;
}

}  // namespace

#define NXBASE_LINALG_BOTH(T)                                                                 \
    void LinAlg::InitV(T* pV, T axK, int alN) {                                               \
        InitVT(pV, axK, alN);                                                                 \
    }                                                                                         \
    void LinAlg::CopyVector(T* pDest, const T* pSrc, int alN) {                               \
        CopyVectorT(pDest, pSrc, alN);                                                        \
    }                                                                                         \
    void LinAlg::CopyMatrix(T* pDest, const T* pSrc, int alRows, int alCols) {                \
        CopyVectorT(pDest, pSrc, alRows* alCols);                                             \
    }                                                                                         \
    void LinAlg::VAddV(T* pDest, const T* pA, const T* pB, int alN) {                         \
        VAddVT(pDest, pA, pB, alN);                                                           \
    }                                                                                         \
    void LinAlg::VAddV(T* pDest, const T* pA, int alN) {                                      \
        VAddVT(pDest, pA, alN);                                                               \
    }                                                                                         \
    void LinAlg::VSubV(T* pDest, const T* pA, const T* pB, int alN) {                         \
        VSubVT(pDest, pA, pB, alN);                                                           \
    }                                                                                         \
    void LinAlg::VSubV(T* pDest, const T* pA, int alN) {                                      \
        VSubVT(pDest, pA, alN);                                                               \
    }                                                                                         \
    void LinAlg::VxV(T* pDest, const T* pA, const T* pB, int alN) {                           \
        VxVT(pDest, pA, pB, alN);                                                             \
    }                                                                                         \
    void LinAlg::VxV(T* pDest, const T* pA, int alN) {                                        \
        VxVT(pDest, pA, alN);                                                                 \
    }                                                                                         \
    void LinAlg::VdivV(T* pDest, const T* pA, const T* pB, int alN) {                         \
        VdivVT(pDest, pA, pB, alN);                                                           \
    }                                                                                         \
    void LinAlg::VAddKxV(T* pDest, T axK, const T* pA, int alN) {                             \
        VAddKxVT(pDest, axK, pA, alN);                                                        \
    }                                                                                         \
    void LinAlg::KVAddKV(T* pDest, T axK1, const T* pA, T axK2, const T* pB, int alN) {       \
        KVAddKVT(pDest, axK1, pA, axK2, pB, alN);                                             \
    }                                                                                         \
    void LinAlg::KxV(T* pDest, T axK, const T* pA, int alN) {                                 \
        KxVT(pDest, axK, pA, alN);                                                            \
    }                                                                                         \
    void LinAlg::KxV(T* pDest, T axK, int alN) {                                              \
        KxVT(pDest, axK, alN);                                                                \
    }                                                                                         \
    void LinAlg::KxM(T* pDest, T axK, const T* pA, int alRows, int alCols) {                  \
        KxVT(pDest, axK, pA, alRows* alCols);                                                 \
    }                                                                                         \
    void LinAlg::KxM(T* pDest, T axK, int alRows, int alCols) {                               \
        KxVT(pDest, axK, alRows* alCols);                                                     \
    }                                                                                         \
    T LinAlg::SumV(const T* pV, int alN) {                                                    \
        return SumVT(pV, alN);                                                                \
    }                                                                                         \
    T LinAlg::DotProd(const T* pA, const T* pB, int alN) {                                    \
        return DotProdT(pA, pB, alN);                                                         \
    }                                                                                         \
    T LinAlg::BetragV(const T* pV, int alN) {                                                 \
        return BetragVT(pV, alN);                                                             \
    }                                                                                         \
    void LinAlg::MxV(T* pR, const T* pM, const T* pV, int alRows, int alCols, int alStride) { \
        MxVT(pR, pM, pV, alRows, alCols, alStride);                                           \
    }                                                                                         \
    void LinAlg::MxV(T* pR, const T* pM, const T* pV, int alRows, int alCols) {               \
        MxVT(pR, pM, pV, alRows, alCols, alCols);                                             \
    }                                                                                         \
    void LinAlg::MtxV(T* pR, const T* pM, const T* pV, int alRows, int alCols) {              \
        MtxVT(pR, pM, pV, alRows, alCols);                                                    \
    }                                                                                         \
    void LinAlg::MxM(T* pC, const T* pA, const T* pB, int alN, int alM, int alP) {            \
        MxMT(pC, pA, pB, alN, alM, alP);                                                      \
    }                                                                                         \
    void LinAlg::TranspM(T* pT, const T* pM, int alRows, int alCols) {                        \
        TranspMT(pT, pM, alRows, alCols);                                                     \
    }                                                                                         \
    void LinAlg::MaTxMa(const T* pA, int alRows, int alCols, T* pN) {                         \
        MaTxMaT(pA, alRows, alCols, pN);                                                      \
    }                                                                                         \
    void LinAlg::GaussEl(T* pB, T* pA, T* pX, int alN, int& axSingular, int* pRowStart,       \
                         int* pRowIndex) {                                                    \
        GaussElT(pB, pA, pX, alN, axSingular, pRowStart, pRowIndex);                          \
    }                                                                                         \
    void LinAlg::GaussEl(T* pB, T* pA, T* pX, int alN, int& axSingular) {                     \
        GaussElT(pB, pA, pX, alN, axSingular);                                                \
    }                                                                                         \
    void LinAlg::LeastSquareFit(T* pW, T* pY, T* pA, T* pX, int alM, int alN, T* pN, T* pR,   \
                                int* pRowStart, int* pRowIndex, int& axOk) {                  \
        LeastSquareFitT(pW, pY, pA, pX, alM, alN, pN, pR, pRowStart, pRowIndex, axOk);        \
    }

NXBASE_LINALG_BOTH(float)
NXBASE_LINALG_BOTH(double)

#undef NXBASE_LINALG_BOTH
