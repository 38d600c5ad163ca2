// Shared by the module's parts: argument checks and conversions.
#ifndef NXBASE_PYTHON_COMMON_H_
#define NXBASE_PYTHON_COMMON_H_

#include <pybind11/numpy.h>
#include <pybind11/pybind11.h>

namespace nxpy {

namespace py = pybind11;

void RegisterColour(py::module_& module);
void RegisterMessaging(py::module_& module);

}  // namespace nxpy

#endif  // NXBASE_PYTHON_COMMON_H_
