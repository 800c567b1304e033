// The facade's version queries, the error report helper, and what the
// library exports.
#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>

#include "LogCapture.h"

#include <gtest/gtest.h>

#include <dlfcn.h>

namespace {

char const* const kLogger = "Helmgard.IC.InstrumentationControl";

void expectOneEventOnBothChannels(ictest::LogCapture const& cap, std::string const& function,
                                  std::string const& message, int level)
{
    auto const all = cap.records();
    ASSERT_EQ(all.size(), 2u);
    EXPECT_EQ(all[0].channel, HGLog::Channel::Log);
    EXPECT_EQ(all[1].channel, HGLog::Channel::Trace);
    for (auto const& r : all) {
        EXPECT_EQ(r.function, function);
        EXPECT_EQ(r.file, "InstrumentationControl");
        EXPECT_EQ(r.logger, kLogger);
        EXPECT_EQ(r.level, level);
        EXPECT_EQ(r.message, message);
    }
    EXPECT_EQ(all[0].line, all[1].line);
}

TEST(InstrumentationControlVersions, BothAreOnePointZeroAndEachCallLogs)
{
    IC::InstrumentationControl const facade;
    {
        ictest::LogCapture cap;
        EXPECT_EQ(facade.getModuleVersion(), IC::Number(IC::Version2{1, 0}));
        expectOneEventOnBothChannels(cap, "getModuleVersion", "getModuleVersion:", 3000);
    }
    {
        ictest::LogCapture cap;
        EXPECT_EQ(facade.getInterfaceVersion(), IC::Number(IC::Version2{1, 0}));
        expectOneEventOnBothChannels(cap, "getInterfaceVersion", "getInterfaceVersion:", 3000);
    }
}

TEST(InstrumentationControlDiagError, LogsContextColonAndTheErrorText)
{
    IC::Error e(1, IC::Number(4u), "something broke");
    ictest::LogCapture cap;
    IC::InstCtrl::diagError(&e, "getNodeCallBackMI: failure");
    expectOneEventOnBothChannels(cap, "diagError",
                                 "getNodeCallBackMI: failure: " + static_cast<std::string>(e), 6000);
}

TEST(InstrumentationControlDiagError, NullErrorIsReportedNotDereferenced)
{
    ictest::LogCapture cap;
    IC::InstCtrl::diagError(nullptr, "ctx");
    ASSERT_EQ(cap.logs().size(), 1u);
    EXPECT_EQ(cap.logs()[0].message.rfind("ctx: ", 0), 0u);
}

TEST(InstrumentationControlGlobals, SharedSuccessValue)
{
    EXPECT_EQ(IC::InstCtrl::donegood.getStatus(), 0);
    EXPECT_EQ(IC::InstCtrl::donegood.getCode(), IC::Number(IC::Number::Generic));
    EXPECT_EQ(IC::InstCtrl::donegood.getText(), "");
}

// Looks a symbol up in the library as a client that dlopens it would.
class Exports : public testing::Test {
protected:
    void SetUp() override
    {
        handle_ = dlopen(IC_LIBRARY_PATH, RTLD_NOW | RTLD_LOCAL);
        ASSERT_NE(handle_, nullptr) << dlerror();
    }
    void TearDown() override
    {
        if (handle_)
            dlclose(handle_);
    }
    bool has(char const* mangled) { return dlsym(handle_, mangled) != nullptr; }
    void* handle_ = nullptr;
};

TEST_F(Exports, PublicStateAndClassesAreVisible)
{
    EXPECT_TRUE(has("_ZN2IC8InstCtrl9nodestoreE"));
    EXPECT_TRUE(has("_ZN2IC8InstCtrl8donegoodE"));
    EXPECT_TRUE(has("_ZN2IC8InstCtrl9diagErrorEPNS_5ErrorENSt7__cxx1112basic_stringIcSt11char_traitsIcESaIcEEE"));
    EXPECT_TRUE(has("_ZNK2IC22InstrumentationControl16getModuleVersionEv"));
    EXPECT_TRUE(has("_ZN2IC9NodeStore12addNodeIfNewERKPNS_4NodeERb"));
}

TEST_F(Exports, PrivateStateStaysInside)
{
    EXPECT_FALSE(has("_ZN2IC8InstCtrl8loggerICB5cxx11E"));
    EXPECT_FALSE(has("_ZN2IC8InstCtrl8loggerICE"));
    EXPECT_FALSE(has("_ZN2IC8InstCtrl2icE"));
    EXPECT_FALSE(has("_ZN2IC8InstCtrl5myiceE"));
    EXPECT_FALSE(has("_ZN2IC8InstCtrl5lderrE"));
    EXPECT_FALSE(has("_ZN2IC9NODESTORE4NSTSB5cxx11E"));
    EXPECT_FALSE(has("_ZN2IC9NODESTORE4NSTSE"));
    EXPECT_FALSE(has("_ZN2IC9NODESTORE15loggerNodeStoreB5cxx11E"));
    EXPECT_FALSE(has("_ZN2IC9NODESTORE15loggerNodeStoreE"));
}

} // namespace
