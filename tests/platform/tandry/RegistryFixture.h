#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <condition_variable>
#include <future>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "platform/log/Log.h"
#include "platform/plist/PropertyList.h"
#include "platform/services/SdkDictionaries.h"
#include "platform/system/Directories.h"
#include "platform/system/FileStamp.h"
#include "platform/tandry/DiskWorkspace.h"
#include "tests/support/TemporaryDirectory.h"

namespace platform::tandry {

/// Collects what an observer is told: "+identifier" and "-identifier". Usable from any thread.
class Recorder : public WorkspaceObserver {
  public:
    void pluginsDidInstall(const TDPlugInProxyList& plugIns) override { add("+", plugIns); }
    void pluginsWillUninstall(const TDPlugInProxyList& plugIns) override {
        add("-", plugIns);
        // Hidden before the observers hear of it.
        for (const auto& plugIn : plugIns)
            if (workspace->plugInWithUuid(plugIn->plugInUuid)) add("visible ", {plugIn});
    }
    std::vector<std::string> take() {
        std::scoped_lock lock(mutex_);
        return std::exchange(events_, {});
    }
    /// Waits until the condition holds, which is looked at after each event; answers whether it
    /// does. It must not use this object.
    template <class Condition>
    bool waitUntil(Condition condition) {
        std::unique_lock lock(mutex_);
        return changed_.wait_for(lock, std::chrono::seconds(30), condition);
    }
    /// Waits for so many events, and answers all.
    std::vector<std::string> take(std::size_t count) {
        waitUntil([&] { return events_.size() >= count; });
        return take();
    }

    Workspace* workspace = nullptr;

  private:
    void add(const char* sign, const TDPlugInProxyList& plugIns) {
        std::scoped_lock lock(mutex_);
        for (const auto& plugIn : plugIns)
            events_.push_back(sign + plugIn->plugInIdentifier.value_or("?"));
        changed_.notify_all();
    }

    std::mutex mutex_;  // guards events_
    std::condition_variable changed_;
    std::vector<std::string> events_;
};

/// A registry over a directory of its own.
class RegistryTest : public testing::Test {
  protected:
    RegistryTest() {
        directories.runtime = files.path("run");
        directories.dataHome = files.path("home");
        directories.dataDirs = {files.path("share")};
    }
    ~RegistryTest() override { stop(); }

    /// Opens the registry and waits for its first scan, and until directories are watched. What was
    /// written before has settled by then, so that its stamps tell all.
    void start() {
        stop();
        const std::string last = files.write(".last", "");
        while (!FileStamp::of(last).settled) std::this_thread::yield();
        merges = 0;
        sdks = std::make_unique<SdkDictionaries>(directories);
        auto opened = openDiskWorkspace(
            directories, *sdks,
            [this](const Dictionary& sdk, const Dictionary& infoPlist) {
                ++merges;
                if (onMerge) onMerge();
                Dictionary merged = infoPlist;
                for (const auto& [key, value] : sdk)
                    if (!merged.contains(key)) merged.set(key, value);
                return merged;
            },
            watching);
        ASSERT_TRUE(opened) << opened.error().text;
        workspace = std::move(*opened);
        recorder.workspace = workspace.get();
        observation = workspace->addObserver(recorder);
        workspace->activate();
        settle();  // behind the first scan, which orders a second walk
        settle();
    }
    /// Waits until the registry's thread has done what it was given.
    void settle() { static_cast<void>(unregisterPlugIn("/nowhere")); }
    std::optional<Error> registerPlugIn(const std::string& path) {
        return workspace->registerPlugIn(path, Requester::Unconfined);
    }
    std::optional<Error> unregisterPlugIn(const std::string& path) {
        return workspace->unregisterPlugIn(path, Requester::Unconfined);
    }
    void stop() {
        observation.reset();
        workspace.reset();
    }

    void writePlist(const std::string& file, const Dictionary& dictionary) {
        auto xml = writeXmlPropertyList(dictionary);
        ASSERT_TRUE(xml) << xml.error().text;
        files.write(file, *xml);
    }
    /// A plug-in bundle whose Info.plist holds an identifier, a VXExtension dictionary and `more`.
    std::string addPlugIn(const std::string& path, const std::string& identifier,
                          const Dictionary& extension = {{"VXExtensionAttributes", Dictionary()}},
                          const Dictionary& more = {}) {
        Dictionary info = more;
        info.set("QFBundleIdentifier", identifier);
        info.set("VXExtension", extension);
        writePlist(path + "/Info.plist", info);
        return files.path(path);
    }
    std::string addApplication(const std::string& path, const Dictionary& info = {}) {
        writePlist(path + "/Info.plist", info);
        return files.path(path);
    }

    std::vector<std::string> installed() {
        std::vector<std::string> identifiers;
        for (const auto& plugIn : workspace->installedPlugIns())
            identifiers.push_back(plugIn->plugInIdentifier.value_or("?"));
        return identifiers;
    }
    TDPlugInProxyRef plugIn(const std::string& identifier) {
        for (const auto& plugIn : workspace->installedPlugIns())
            if (plugIn->plugInIdentifier == identifier) return plugIn;
        return nullptr;
    }

    const std::string apps = "home/zorvan/Applications/";
    /// Nothing is noticed by itself, unless a test wants that.
    WatchSettings watching{.quiet = std::chrono::hours(1),
                           .quietWhenWhole = std::chrono::hours(1),
                           .longest = std::chrono::hours(1)};
    test::TemporaryDirectory files;
    Directories directories;
    std::unique_ptr<SdkDictionaries> sdks;
    Recorder recorder;
    int merges = 0;                 // how many plug-ins with an SDK dictionary were read
    std::function<void()> onMerge;  // called in the midst of a walk, when such a plug-in is read
    std::unique_ptr<Workspace> workspace;
    std::unique_ptr<Workspace::Observation> observation;
};

/// The error lines written while it lives.
class ErrorLines {
  public:
    std::vector<std::string> lines;

  private:
    LogCapture capture_{[this](const std::string&, LogLevel level, const std::string& text) {
        if (level == LogLevel::Error) lines.push_back(text);
    }};
};

using testing::AllOf;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::UnorderedElementsAre;

}  // namespace platform::tandry
