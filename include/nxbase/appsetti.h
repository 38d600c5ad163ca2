// NxSetting holds the user's colour-evaluation settings (identifier
// "NxSetting"), kept in the user configuration, group "Settings":
// "MetamerieTL1", "MetamerieTL2" (illuminant names of the metamerism test),
// "DirectLightPart" (decimal, default "0.5") and "MeasurementDisplay" ("Eye"
// or "Instrument"). Created on first use on the main thread; not locked.
// Part of the colorimetry family, as it speaks of illuminants: configuration
// code below it does not include it.
#ifndef NXBASE_APPSETTI_H_
#define NXBASE_APPSETTI_H_

#include "nxbase/cmetryfilter.h"
#include "nxbase/export.h"
#include "nxbase/singleton.h"
#include "toolkit/string.h"

class NXBASE_EXPORT NxSetting : public NxSingleton {
  public:
    enum MeasurementDisplay { INSTRUMENT = 0, EYE = 1 };

    // Creates, registers and loads the settings on the first call; never fails.
    static NxSetting* Instance();

    // Reads the four keys from the user configuration; does nothing unless
    // UserConfig::IsInitialized(). A "DirectLightPart" that is not wholly a
    // finite decimal number without locale (one sign, "+" allowed; "+-0.5",
    // "0.5x" or "1,25" is not) reads as 0.5; the display is EYE exactly when the text
    // is "Eye".
    void LoadProperties();
    // Writes the four keys to the user configuration (the direct-light part
    // with 2 decimals); does nothing unless UserConfig::IsInitialized().
    void SaveProperties();

    // The two illuminants of the metamerism test. A name the colorimetry data
    // does not know (or an empty one) gives its default illuminant.
    void GetIllumClasses(IllumClass& axFirst, IllumClass& axSecond) const;
    const IllumClass& GetIllumClass1() const { return amIllum1; }
    const IllumClass& GetIllumClass2() const { return amIllum2; }
    void SetIllumClasses(IllumClass axFirst, IllumClass axSecond);

    MeasurementDisplay GetMeasurementDisplay() const { return amDisplay; }
    void SetMeasurementDisplay(MeasurementDisplay axDisplay) { amDisplay = axDisplay; }
    double GetDirectLightPart() const { return amDirectLightPart; }
    void SetDirectLightPart(double axPart) { amDirectLightPart = axPart; }

    ~NxSetting() override;

  private:
    NxSetting();
    template <class T, class Load>
    friend T* nxbase::LazySingletonInstance(T*&, Load);

    IllumClass amIllum1;
    IllumClass amIllum2;
    MeasurementDisplay amDisplay = INSTRUMENT;
    double amDirectLightPart = 0.5;
    static NxSetting* smInstance;
};

#endif  // NXBASE_APPSETTI_H_
