// The Python module "nxbase": the library's colour science over NumPy arrays
// and a post-office client. Importing does no work beyond registering names.
#include "common.h"
#include "nxbase/version.h"

PYBIND11_MODULE(nxbase, module) {
    module.doc() =
        "NxBase colour science for NumPy arrays (spectra of shape (..., 36), 380..730 nm in "
        "10 nm steps, in; (..., 3) out) and a client of the NxBase post office.";
    module.attr("__version__") = nxbase::Version();
    nxpy::RegisterColour(module);
    nxpy::RegisterMessaging(module);
}
