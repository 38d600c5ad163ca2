// An application built against the installed library: a logged line under a
// named lock, and the Lab value of a flat 50 % grey under the default
// illuminant D50 and the 2° observer, and a colour name from the library's
// shipped texts.
#include <nxbase/colorvector.h>
#include <nxbase/logfile.h>
#include <nxbase/spectrum.h>
#include <nxbase/text.h>
#include <nxbase/thread.h>

#include <cstdio>

int main() {
    CriticalSection section("ConsumerStart");
    LogFile::WriteToLog("consumer started", "");
    ReflectanceSpectrum grey(0.5f, PhysicalConditions());
    LABVector lab(grey);
    std::printf("consumer logged to %s\n", LogFile::Instance()->GetFileName().c_str());
    std::printf("grey 50%%: L* %.2f a* %.2f b* %.2f\n", lab[0], lab[1], lab[2]);
    // The library's own texts, found beside the installed library.
    if (!Text::LoadLibraryTexts(49) || Text::GetText("FarbTexte", 0).str() != "Schwarz") {
        std::printf("the library's texts are missing\n");
        return 1;
    }
    // A flat 50 % reflector is neutral: L* = 116 * 0.5^(1/3) - 16.
    return lab[0] > 76.0f && lab[0] < 76.1f ? 0 : 1;
}
