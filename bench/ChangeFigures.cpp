#include <fcntl.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <optional>

#include "Zorvan/Keys.h"
#include "bench/Failure.h"
#include "bench/Figures.h"
#include "bench/Frames.h"
#include "bench/InfoPlist.h"
#include "bench/Interrupt.h"
#include "bench/Measure.h"
#include "bench/Questions.h"
#include "platform/plist/PropertyList.h"
#include "platform/system/Files.h"

namespace bench {

namespace {

namespace fs = std::filesystem;
using platform::Dictionary;
using platform::UniqueFd;
using platform::Uuid;

/// The least that replacing a file costs if the new one is to outlive a crash.
void replaceBarely(const std::string& path, const std::string& bytes) {
    const std::string temporary = path + ".new";
    const UniqueFd file(::open(temporary.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
    const UniqueFd folder(::open(fs::path(path).parent_path().c_str(), O_RDONLY | O_CLOEXEC));
    if (!file || !folder) failErrno(temporary);
    if (::write(file.get(), bytes.data(), bytes.size()) != static_cast<ssize_t>(bytes.size()) ||
        ::fsync(file.get()) < 0 || ::rename(temporary.c_str(), path.c_str()) < 0 ||
        ::fsync(folder.get()) < 0)
        failErrno(path);
}

/// A file with the annotations of plug-ins that were installed once.
void storeAnnotations(const std::string& path, std::size_t count) {
    std::vector<Dictionary::Entry> data;
    for (std::size_t i = 0; i < count; ++i) {
        const Dictionary extension{{"note", fmt::format("Chosen for document {}", i)},
                                   {"pinned", i % 2 == 0}};
        data.emplace_back(fmt::format("org.example.once-installed.plug-in-{:05}", i),
                          Dictionary{{zorvan::annotation::kElection, i % 3},
                                     {zorvan::annotation::kExtension, extension}});
    }
    const Dictionary root{{"version", 16}, {"data", *Dictionary::fromEntries(std::move(data))}};
    const auto text = platform::writeXmlPropertyList(root, 256u << 20);
    if (!text) fail("{}", text.error().text);
    fs::create_directories(fs::path(path).parent_path());
    replaceBarely(path, *text);
}

/// A daemon with a store of `count` annotations, and some of its plug-ins.
struct Storing {
    Child daemon;
    FrameClient client;
    std::vector<Uuid> plugIns;

    Storing(const World& world, std::size_t count, const Question& question)
        : daemon((storeAnnotations(world.annotationsFile(), count), world.startDaemon())),
          client(waitForSocket(world.socketPath(), daemon)),
          plugIns(uuidsIn(client.exchange(question.frame))) {
        if (plugIns.size() != question.answers) fail("{} plug-ins to annotate", plugIns.size());
        daemon.waitUntilIdle();
    }
};

std::string readStored(const World& world) {
    auto text = platform::readFile(world.annotationsFile(), 256u << 20);
    if (!text) fail("{}", text.error().text);
    return std::move(*text);
}

void measureAnnotate(const Run& run, std::size_t count) {
    const std::string key = fmt::format("annotate-{}/p50", count);
    const std::string sizeKey = fmt::format("annotate-{}/file-bytes", count);
    if (!run.report.wants({key, sizeKey})) return;
    const World& world = run.worlds[1];
    Storing storing(world, count, Question::byPoint(10));
    const std::string request = annotateRequest(storing.plugIns[0]);
    expectSuccess(storing.client.exchange(request));
    const std::string stored = readStored(world);
    const std::string beside = world.annotationsFile() + ".bare";
    const Plan plan{count < 10000 ? 400 : 60, 5, run.quick ? 0.3 : 2.5};
    const auto p50 = medianOfEach(plan, {timed([&] { storing.client.exchange(request); }),
                                         timed([&] { replaceBarely(beside, stored); })});
    run.report.add({.key = key,
                    .title = fmt::format("annotate with {} stored, p50", count),
                    .value = p50[0],
                    .besideSource = "baseline",
                    .beside = p50[1],
                    .now = {Target::Kind::RatioAtMost, 3}});
    run.report.add({.key = sizeKey,
                    .title = "  its file",
                    .value = static_cast<double>(stored.size()),
                    .unit = "B"});
}

/// Beside it, as many bare replacements of the file as it is in the end; a tenth of them is made.
void measureBulkAnnotate(const Run& run) {
    constexpr std::size_t kEntries = 1000;
    const std::string key = fmt::format("bulk-annotate-{}/p50", kEntries);
    if (!run.report.wants({key})) return;
    const World& world = run.worlds[1];
    Storing storing(world, 0, Question::ofAll(kEntries));
    const std::string request = bulkAnnotateRequest(storing.plugIns);
    expectSuccess(storing.client.exchange(request));
    const std::string stored = readStored(world);
    std::vector<double> bulk, bare;
    for (int i = 0; i < run.freshScans; ++i) {
        checkInterrupted();
        bulk.push_back(timed([&] { storing.client.exchange(request); })());
        bare.push_back(10 * timed([&] {
                           for (std::size_t entry = 0; entry < kEntries / 10; ++entry)
                               replaceBarely(world.annotationsFile() + ".bare", stored);
                       })());
    }
    run.report.add({.key = key,
                    .title = fmt::format("bulk-annotate of {}, p50", kEntries),
                    .value = median(std::move(bulk)),
                    .besideSource = "baseline",
                    .beside = median(std::move(bare))});
}

/// An application with one plug-in, which no other has the extension point of.
class Newcomer {
  public:
    Newcomer(const Run& run, const World& world)
        : source_(run.scratch + "/Newcomer.app"),
          target_(world.applications() + "/Newcomer.app"),
          staged_(world.applications() + "/.Newcomer.new") {
        const std::string plugIn = source_ + "/PlugIns/Newcomer.appex";
        fs::create_directories(plugIn);
        std::ofstream(source_ + "/Info.plist") << applicationInfo(99999);
        std::ofstream(plugIn + "/Info.plist") << plugInInfo(99999, kPoint, "");
        std::ofstream(plugIn + "/PlugIn99999") << "#!/bin/sh\n";
        ::chmod((plugIn + "/PlugIn99999").c_str(), 0755);
    }
    Newcomer(const Newcomer&) = delete;
    ~Newcomer() {
        remove();
        std::error_code ignored;
        fs::remove_all(source_, ignored);
    }

    void install() { copyTo(target_); }
    /// To be renamed into place in whole.
    void prepare() { copyTo(staged_); }
    void installPrepared() { fs::rename(staged_, target_); }
    void remove() {
        std::error_code ignored;
        fs::remove_all(target_, ignored);
    }

    static constexpr const char* kPoint = "org.example.point-of-a-newcomer";

  private:
    void copyTo(const std::string& place) { fs::copy(source_, place, fs::copy_options::recursive); }

    std::string source_;
    std::string target_;
    std::string staged_;
};

/// Microseconds until a match finds what it is asked for; none when it takes over five seconds.
std::optional<double> timeUntilFound(FrameClient& client, const Question& question) {
    constexpr timespec kPause{0, 500'000};
    const double start = now();
    while (now() < start + 5e6) {
        checkInterrupted();
        const std::string_view reply = client.exchange(question.frame);
        const double time = now() - start;
        if (uuidsIn(reply).size() == question.answers) return time;
        // Pausing leaves the CPU to the daemon.
        ::nanosleep(&kPause, nullptr);
    }
    return std::nullopt;
}

/// How the newcomer comes: piece by piece, or in whole.
enum class Arrival { Copied, Renamed };

void measureAppearance(const Run& run, Arrival arrival) {
    const bool isCopied = arrival == Arrival::Copied;
    const std::string key = isCopied ? "appear/p50" : "appear/renamed/p50";
    if (!run.report.wants({key})) return;
    const World& world = run.worlds[1];
    Storing storing(world, 0, Question::byPoint(10));
    Newcomer newcomer(run, world);
    const Question present = Question::byPointNamed(Newcomer::kPoint, 1);
    const Question absent = Question::byPointNamed(Newcomer::kPoint, 0);
    std::vector<double> samples;
    for (int i = 0; i < (run.quick ? 1 : 7); ++i) {
        if (isCopied) {
            newcomer.install();
        } else {
            newcomer.prepare();
            newcomer.installPrepared();
        }
        const std::optional<double> time = timeUntilFound(storing.client, present);
        newcomer.remove();
        if (!time || !timeUntilFound(storing.client, absent)) {
            fmt::print(stderr,
                       "zrd_bench: no figure {}: the daemon does not notice a bundle within 5 s\n",
                       key);
            return;
        }
        samples.push_back(*time);
    }
    run.report.add({.key = key,
                    .title = fmt::format("bundle {}, to its first match, p50",
                                         isCopied ? "copied in" : "renamed into place"),
                    .value = median(std::move(samples)),
                    .now = {Target::Kind::ValueAtMost, isCopied ? 500e3 : 20e3}});
}

}  // namespace

void measureChanges(const Run& run) {
    for (const std::size_t count : {10, 1000, 10000}) measureAnnotate(run, count);
    measureBulkAnnotate(run);
    for (const Arrival arrival : {Arrival::Copied, Arrival::Renamed})
        measureAppearance(run, arrival);
}

}  // namespace bench
