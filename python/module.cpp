// The Python module "nxbase": the library's colour science over NumPy arrays
// and a post-office client. Importing does no work beyond registering names.
#include "common.h"
#include "nxbase/version.h"

namespace {

namespace py = pybind11;

// Process workers (multiprocessing, Dask's distributed workers) receive the
// functions they run by pickle. A function of an extension module normally
// pickles by name, but pybind11's carry a capsule as their `self`, which
// pickle cannot take: this module's functions pickle by name, as Python's
// own do; every other built-in function as before.
void PickleFunctionsByName(py::module_& module) {
    const py::str name = module.attr("__name__");
    const py::object builtinFunction = py::type::of(module.attr("spectra_to_Lab"));
    py::module_::import("copyreg").attr("pickle")(
        builtinFunction, py::cpp_function([name](py::object function) -> py::object {
            const bool ours = py::hasattr(function, "__module__") &&
                              py::object(function.attr("__module__")).equal(name) &&
                              py::isinstance<py::capsule>(function.attr("__self__"));
            return ours ? function.attr("__name__") : function.attr("__reduce__")();
        }));
}

}  // namespace

PYBIND11_MODULE(nxbase, module) {
    module.doc() =
        "NxBase colour science for NumPy arrays (spectra of shape (..., 36), 380..730 nm in "
        "10 nm steps, in; (..., 3) out) and a client of the NxBase post office.";
    module.attr("__version__") = nxbase::Version();
    nxpy::RegisterColour(module);
    nxpy::RegisterMessaging(module);
    PickleFunctionsByName(module);
}
