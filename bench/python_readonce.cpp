// nxbench_readonce: the memory-bandwidth yardstick of bench/python_bench.py.
// read_once(spectra, threads) reads a C-contiguous float32 array once, with
// the prefetch of the batch kernel, on the calling thread or in two halves on
// two threads, without the GIL: nothing converts spectra faster than this.
#include <pybind11/numpy.h>
#include <pybind11/pybind11.h>

#include <cstddef>
#include <stdexcept>
#include <thread>

#include "color_baseline.h"

namespace py = pybind11;

namespace {

float ReadOnce(const py::array_t<float, py::array::c_style>& spectra, unsigned threads) {
    if (threads != 1 && threads != 2) throw std::invalid_argument("threads must be 1 or 2");
    const float* data = spectra.data();
    const std::size_t values = static_cast<std::size_t>(spectra.size());
    py::gil_scoped_release unlocked;
    if (threads == 1) return colorbench::StreamingSum(data, values);
    const std::size_t half = values / 2;
    float other = 0;
    std::thread second([&] { other = colorbench::StreamingSum(data + half, values - half); });
    const float first = colorbench::StreamingSum(data, half);
    second.join();
    return first + other;
}

}  // namespace

PYBIND11_MODULE(nxbench_readonce, m) {
    m.doc() = "One read of an array of float32 spectra: the bound of spectra_to_Lab's rate";
    m.def("read_once", &ReadOnce, py::arg("spectra"), py::arg("threads") = 1);
}
