// LinAlg: static vector and matrix routines on plain float and double arrays,
// Gaussian elimination and a weighted least-squares fit. No state; any thread.
//
// A vector is n contiguous elements; a matrix is rows x cols elements stored
// row by row (element (i, j) at i*cols + j). No routine allocates its result
// (except GaussEl's short form, for its index arrays), checks pointers or
// sizes, or allows the destination to overlap a source unless it is the
// in-place form. Every routine exists for float and for double with the same
// behaviour; sums accumulate in the element type, in index order.
#ifndef NXBASE_LINALG_H_
#define NXBASE_LINALG_H_

#include "nxbase/export.h"

class NXBASE_EXPORT LinAlg {
  public:
    LinAlg() = default;
    LinAlg(const LinAlg&) = default;
    LinAlg& operator=(const LinAlg&) = default;

    // pV[i] = axK.
    static void InitV(float* pV, float axK, int alN);
    static void InitV(double* pV, double axK, int alN);

    // pDest[i] = pSrc[i].
    static void CopyVector(float* pDest, const float* pSrc, int alN);
    static void CopyVector(double* pDest, const double* pSrc, int alN);
    // CopyVector of alRows * alCols elements.
    static void CopyMatrix(float* pDest, const float* pSrc, int alRows, int alCols);
    static void CopyMatrix(double* pDest, const double* pSrc, int alRows, int alCols);

    // pDest[i] = pA[i] + pB[i]; in-place form pDest[i] += pA[i].
    static void VAddV(float* pDest, const float* pA, const float* pB, int alN);
    static void VAddV(double* pDest, const double* pA, const double* pB, int alN);
    static void VAddV(float* pDest, const float* pA, int alN);
    static void VAddV(double* pDest, const double* pA, int alN);

    // pDest[i] = pA[i] - pB[i]; in-place form pDest[i] -= pA[i].
    static void VSubV(float* pDest, const float* pA, const float* pB, int alN);
    static void VSubV(double* pDest, const double* pA, const double* pB, int alN);
    static void VSubV(float* pDest, const float* pA, int alN);
    static void VSubV(double* pDest, const double* pA, int alN);

    // Element-wise product pDest[i] = pA[i] * pB[i]; in-place pDest[i] *= pA[i].
    static void VxV(float* pDest, const float* pA, const float* pB, int alN);
    static void VxV(double* pDest, const double* pA, const double* pB, int alN);
    static void VxV(float* pDest, const float* pA, int alN);
    static void VxV(double* pDest, const double* pA, int alN);

    // pDest[i] = pA[i] / pB[i]; no zero test (IEEE infinities and NaNs result).
    static void VdivV(float* pDest, const float* pA, const float* pB, int alN);
    static void VdivV(double* pDest, const double* pA, const double* pB, int alN);

    // pDest[i] += axK * pA[i].
    static void VAddKxV(float* pDest, float axK, const float* pA, int alN);
    static void VAddKxV(double* pDest, double axK, const double* pA, int alN);

    // pDest[i] = axK1 * pA[i] + axK2 * pB[i].
    static void KVAddKV(float* pDest, float axK1, const float* pA, float axK2, const float* pB,
                        int alN);
    static void KVAddKV(double* pDest, double axK1, const double* pA, double axK2, const double* pB,
                        int alN);

    // pDest[i] = axK * pA[i]; in-place form pDest[i] *= axK.
    static void KxV(float* pDest, float axK, const float* pA, int alN);
    static void KxV(double* pDest, double axK, const double* pA, int alN);
    static void KxV(float* pDest, float axK, int alN);
    static void KxV(double* pDest, double axK, int alN);

    // KxV over alRows * alCols elements.
    static void KxM(float* pDest, float axK, const float* pA, int alRows, int alCols);
    static void KxM(double* pDest, double axK, const double* pA, int alRows, int alCols);
    static void KxM(float* pDest, float axK, int alRows, int alCols);
    static void KxM(double* pDest, double axK, int alRows, int alCols);

    // Sum of pV[0..alN-1].
    static float SumV(const float* pV, int alN);
    static double SumV(const double* pV, int alN);
    // Sum of pA[i] * pB[i].
    static float DotProd(const float* pA, const float* pB, int alN);
    static double DotProd(const double* pA, const double* pB, int alN);
    // Euclidean length: square root of the sum of pV[i]^2.
    static float BetragV(const float* pV, int alN);
    static double BetragV(const double* pV, int alN);

    // pR[i] = sum over j < alCols of pM[i * alStride + j] * pV[j], i < alRows.
    // The stride lets a sub-block of a wider matrix be used; the short form
    // takes alStride = alCols.
    static void MxV(float* pR, const float* pM, const float* pV, int alRows, int alCols,
                    int alStride);
    static void MxV(double* pR, const double* pM, const double* pV, int alRows, int alCols,
                    int alStride);
    static void MxV(float* pR, const float* pM, const float* pV, int alRows, int alCols);
    static void MxV(double* pR, const double* pM, const double* pV, int alRows, int alCols);

    // pR = M^T * v: pR[j] = sum over i < alRows of pM[i * alCols + j] * pV[i].
    static void MtxV(float* pR, const float* pM, const float* pV, int alRows, int alCols);
    static void MtxV(double* pR, const double* pM, const double* pV, int alRows, int alCols);

    // pC (n x p) = pA (n x m) * pB (m x p).
    static void MxM(float* pC, const float* pA, const float* pB, int alN, int alM, int alP);
    static void MxM(double* pC, const double* pA, const double* pB, int alN, int alM, int alP);

    // pT (cols x rows) with pT[j * rows + i] = pM[i * cols + j].
    static void TranspM(float* pT, const float* pM, int alRows, int alCols);
    static void TranspM(double* pT, const double* pM, int alRows, int alCols);

    // pN (cols x cols) = A^T * A. Only elements with column >= row are summed;
    // each is written to (i, j) and (j, i).
    static void MaTxMa(const float* pA, int alRows, int alCols, float* pN);
    static void MaTxMa(const double* pA, int alRows, int alCols, double* pN);

    // Solves pA * pX = pB for an n x n matrix by Gaussian elimination with
    // row pivoting through the index arrays pRowStart and pRowIndex (n ints
    // each; rows are never moved). The pivot of column k is the first row
    // i >= k with the strictly largest |A(i, k)|. Only an exactly zero pivot
    // counts as singular: then axSingular = 1 and the routine returns at once,
    // leaving pX as it was. Otherwise axSingular = 0 and pX holds the result.
    // pA and pB are overwritten (the eliminated entries are not cleared).
    static void GaussEl(float* pB, float* pA, float* pX, int alN, int& axSingular, int* pRowStart,
                        int* pRowIndex);
    static void GaussEl(double* pB, double* pA, double* pX, int alN, int& axSingular,
                        int* pRowStart, int* pRowIndex);
    // As above; allocates the two index arrays itself.
    static void GaussEl(float* pB, float* pA, float* pX, int alN, int& axSingular);
    static void GaussEl(double* pB, double* pA, double* pX, int alN, int& axSingular);

    // Weighted least squares for alM observations of alN unknowns: pW weights
    // (m), pY observations (m), pA design matrix (m x n), pX results (n), pN a
    // work matrix (n x n), pR a work vector (n), pRowStart and pRowIndex n ints
    // for GaussEl. axOk = 0 when m < n (nothing computed, pX untouched) or the
    // system is singular; otherwise 1. With m = n, pA * pX = pY is solved
    // directly and the weights are not used; with m > n each row of pA and each
    // pY[i] is multiplied by pW[i] in place (so the weights enter the normal
    // equations squared) and N x = A^T y is solved. pA, pY, pN, pR are
    // overwritten.
    static void LeastSquareFit(float* pW, float* pY, float* pA, float* pX, int alM, int alN,
                               float* pN, float* pR, int* pRowStart, int* pRowIndex, int& axOk);
    static void LeastSquareFit(double* pW, double* pY, double* pA, double* pX, int alM, int alN,
                               double* pN, double* pR, int* pRowStart, int* pRowIndex, int& axOk);
};

#endif  // NXBASE_LINALG_H_
