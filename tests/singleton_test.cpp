#include "nxbase/singleton.h"

#include <gtest/gtest.h>

#include <optional>
#include <random>
#include <string>
#include <vector>

namespace {

std::vector<std::string> destroyed;

// A second base ahead of NxSingleton, so that the registered pointer differs
// from the object's address.
struct Padding {
    virtual ~Padding() = default;
    char bytes[24] = {};
};
class OffsetService : public Padding, public NxSingleton {
  public:
    OffsetService() : NxSingleton("OffsetService") {}
    ~OffsetService() override { destroyed.push_back("OffsetService"); }
};

class Plain : public NxSingleton {
  public:
    explicit Plain(const std::string& name) : NxSingleton(name) {}
    ~Plain() override { destroyed.push_back(GetIdentifier()); }
};

// Stores itself in its instance pointer when built, as some services do.
class SelfStoring : public NxSingleton {
  public:
    SelfStoring(const std::string& name, bool store) : NxSingleton(name) {
        if (store) smInstance = this;
    }
    ~SelfStoring() override {
        destroyed.push_back(GetIdentifier());
        if (smInstance == this) smInstance = nullptr;
    }
    static SelfStoring* smInstance;
};
SelfStoring* SelfStoring::smInstance = nullptr;

class NxSingletonTest : public ::testing::Test {
  protected:
    void SetUp() override {
        NxSingleton::DeleteAllSingleton();
        destroyed.clear();
    }
    void TearDown() override { NxSingleton::DeleteAllSingleton(); }
};

TEST_F(NxSingletonTest, TeardownDestroysNewestFirstAndEmptyTeardownDoesNothing) {
    NxSingleton::DeleteAllSingleton();
    EXPECT_TRUE(destroyed.empty());
    NxSingleton::Insert(new Plain("A"));
    NxSingleton::Insert(new OffsetService());
    NxSingleton::Insert(new Plain("C"));
    NxSingleton::DeleteAllSingleton();
    EXPECT_EQ(destroyed, (std::vector<std::string>{"C", "OffsetService", "A"}));
    EXPECT_EQ(NxSingleton::RegisteredCount(), 0u);
}

TEST_F(NxSingletonTest, ReplaceKeepsPositionOrAppendsAtTheBack) {
    auto* a = new Plain("A");
    auto* b = new Plain("B");
    NxSingleton::Insert(a);
    NxSingleton::Insert(b);  // registry: B, A
    auto* late = new Plain("late");
    NxSingleton::Replace(reinterpret_cast<NxSingleton*>(0x10), late);  // unknown: back
    auto* b2 = new Plain("B2");
    NxSingleton::Replace(b, b2);  // in place of B, at the front
    delete b;
    NxSingleton::Remove(reinterpret_cast<NxSingleton*>(0x20));  // unknown: ignored
    destroyed.clear();
    NxSingleton::DeleteAllSingleton();
    EXPECT_EQ(destroyed, (std::vector<std::string>{"B2", "A", "late"}));
}

TEST_F(NxSingletonTest, LazyInstanceCreatesRegistersAndLoadsOnce) {
    int loads = 0;
    auto load = [&loads](Plain&) { ++loads; };
    struct Lazy : Plain {
        Lazy() : Plain("Lazy") {}
    };
    Lazy* lazyInstance = nullptr;
    Lazy* first = nxbase::LazySingletonInstance(lazyInstance, load);
    Lazy* again = nxbase::LazySingletonInstance(lazyInstance, load);
    EXPECT_EQ(first, again);
    EXPECT_EQ(loads, 1);
    EXPECT_EQ(NxSingleton::RegisteredCount(), 1u);
}

// Replacement against a model (the live name, the names destroyed, the
// registry's size, a strict Instance() that throws when there is none) over
// random sequences of create, install again, install another, uninstall and
// tear down.
TEST_F(NxSingletonTest, ReplacingAgreesWithAModelOverRandomSequences) {
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    std::optional<std::string> live;
    std::vector<std::string> gone;
    for (int step = 0; step < 2000; ++step) {
        const std::string name = "s" + std::to_string(step);
        auto retire = [&] {
            if (live) gone.push_back(*live);
            live.reset();
        };
        switch (random() % 5) {
            case 0:  // create (the constructor may store itself)
                retire();
                nxbase::CreateOrReplaceSingleton(SelfStoring::smInstance, name, random() % 2 == 0);
                live = name;
                break;
            case 1:  // the live one again: nothing changes
                nxbase::InstallSingleton(SelfStoring::smInstance, SelfStoring::smInstance);
                break;
            case 2:  // another, made elsewhere
                retire();
                nxbase::InstallSingleton(SelfStoring::smInstance, new SelfStoring(name, false));
                live = name;
                break;
            case 3:
                retire();
                nxbase::InstallSingleton<SelfStoring>(SelfStoring::smInstance, nullptr);
                break;
            default:
                retire();
                NxSingleton::DeleteAllSingleton();
                break;
        }
        ASSERT_EQ(destroyed, gone) << "step " << step;
        ASSERT_EQ(NxSingleton::RegisteredCount(), live ? 1u : 0u) << "step " << step;
        ASSERT_EQ(SelfStoring::smInstance ? SelfStoring::smInstance->GetIdentifier() : "",
                  live.value_or(""))
            << "step " << step;
        if (live) {
            ASSERT_EQ(nxbase::StrictSingletonInstance(SelfStoring::smInstance, "none"),
                      SelfStoring::smInstance);
        } else {
            ASSERT_THROW(nxbase::StrictSingletonInstance(SelfStoring::smInstance, "none"),
                         std::logic_error);
        }
    }
}

}  // namespace
