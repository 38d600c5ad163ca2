// Measuring through the measuring-device server LumaServer with the post
// office: the server is started on demand from the registry, locked,
// triggered N times and left again; the spectra become CIELAB. A progress
// listener prints how far the measurement is.
//
//   measure [N]     N patches (default 4)
// The server must be registered (lumaserver --register does it).
#include <nxbase/colorbatch.h>
#include <nxbase/lumaclient.h>
#include <nxbase/postoffice.h>
#include <nxbase/progress.h>
#include <nxbase/singleton.h>

#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

namespace {

class PrintProgress : public ProgressListener {
  public:
    void DisplayProgress(double axProgress) override {
        if (CheckProgressIncrement(axProgress)) std::printf("  %3.0f %%\n", 100.0 * axProgress);
    }
};

}  // namespace

int main(int argc, char** argv) {
    const int count = argc > 1 ? std::atoi(argv[1]) : 4;
    PostOffice* office = PostOffice::CreatePostOffice("MeasureExample");
    std::vector<nxbase::MeasuredSpectrum> measured;
    std::string error;
    PrintProgress progress;
    const bool ok = nxbase::MeasureWithLumaServer(*office, count, &measured, &error, &progress);
    if (!ok) std::fprintf(stderr, "measuring failed: %s\n", error.c_str());

    const nxbase::ColorBatch batch;  // the current filter: D50, 2 degrees
    for (const nxbase::MeasuredSpectrum& spectrum : measured) {
        float lab[3];
        batch.ToLab(spectrum.values.data(), 1, lab);
        std::printf("%-12s L* %6.2f  a* %7.2f  b* %7.2f\n", spectrum.id.c_str(), lab[0], lab[1],
                    lab[2]);
    }
    NxSingleton::DeleteAllSingleton();  // the post office with the rest
    return ok && static_cast<int>(measured.size()) == count ? 0 : 1;
}
