// Measures discovery: answers of the real daemon over its socket, selection by rules, the reduction to one plug-in per
// identifier, memory, and how soon a started daemon answers.
//
//   DiscoveryBench DAEMON [ROUNDS [SECONDS]]
//
// Every figure is taken in rounds that alternate with its reference; see docs/benchmarks.md.

#include "Zembra/ZBProtocol.h"
#include "bench/Bundles.h"
#include "bench/Daemon.h"
#include "bench/EchoServer.h"
#include "bench/Load.h"
#include "bench/RegistryTables.h"
#include "bench/Run.h"
#include "bench/Selection.h"
#include "bench/Statistics.h"
#include "zbd/SameIdentifierReduction.h"
#include "zbd/ZBDAnnotationStore.h"

#include <array>
#include <fstream>
#include <list>
#include <unordered_set>

namespace {

using namespace bench;
using platform::Array;
using platform::UUID;
namespace requestType = zembra::requestType;
namespace key = zembra::key;

constexpr std::size_t fewForms = 20;
constexpr std::size_t manyForms = 1000;
constexpr std::size_t manyBundles = 10'000;
constexpr std::array sizes{std::size_t{1000}, std::size_t{10'000}, std::size_t{100'000}};

/// What grows in proportion keeps its ratio to a reference that does. Caches serve the two somewhat differently.
constexpr double proportionate = 1.5;

constexpr std::string_view groupKey = "SampleGroup";
constexpr std::string_view firstGroup = "group 0";

std::string withThousands(std::size_t number) {
    std::string text = std::to_string(number);
    for (std::size_t place = text.size(); place > 3;) text.insert(place -= 3, 1, ',');
    return text;
}

/// Applications with one plug-in each, of which `fewForms` have the first value of an attribute. Answers the first one.
std::string layOut(const std::string& root, std::size_t plugIns) {
    std::string first;
    for (std::size_t i = 0; i < plugIns; ++i) {
        const std::string name = "Bench" + std::to_string(i);
        const std::string group = "group " + std::to_string(i % (plugIns / fewForms));
        std::string path = writePlugIn(writeApplication(root, name), name, {.attributes = {{groupKey, group}}});
        if (i == 0) first = std::move(path);
    }
    return first;
}

/// The user elected every plug-in: what forms are made of has an annotation in it.
void annotate(const std::string& root, std::size_t plugIns) {
    MutableDictionary annotations;
    for (std::size_t i = 0; i < plugIns; ++i) {
        annotations.set(plugInIdentifier("Bench" + std::to_string(i)),
                        Dictionary{{zembra::annotationKey::election, 1}});
    }
    std::filesystem::create_directories(root + "/var/db");
    std::ofstream(root + "/var/db/Zembra-Annotations") << *platform::encodeXML(
        Dictionary{{"version", zbd::ZBDAnnotationStore::databaseVersion}, {"data", annotations}});
}

Dictionary withRules(const Dictionary& rules) { return {{key::rules, rules}}; }
Dictionary everyRule() { return withRules({{zembra::manifest::pointName, extensionPoint}}); }
Dictionary groupRules() { return withRules({{zembra::manifest::pointName, extensionPoint}, {groupKey, firstGroup}}); }

/// One question whose answer is timed.
struct Question {
    std::string name;
    Target target;
};

/// Fails unless the answer has that many forms, with tokens and annotations.
Question ask(Daemon& daemon, std::size_t forms, std::string name, const Dictionary& rules) {
    const auto matches = decodedMatches(daemon.ask(requestType::match, rules)).array();
    if (!matches || matches->size() != forms) fail("another number of forms");
    const auto form = matches->begin()->dictionary();
    for (const auto part :
         {zembra::formKey::extensions, zembra::formKey::serviceExtension, zembra::formKey::annotations}) {
        if (!form || !form->contains(part) || (*form)[part] == Value(Dictionary())) fail("an incomplete form");
    }
    return {std::move(name), daemon.targetFor({requestFrame(requestType::match, rules)})};
}

void measureAnswer(const Settings& settings, const std::string& directory, std::size_t forms,
                   const std::vector<Question>& questions, const Goal& goal) {
    const Target& plain = questions.front().target;
    EchoProcess echoServer(settings.self, directory + "/echo-" + std::to_string(forms), plain.replySize);
    const Target echo = echoServer.targetLike(plain);
    Series echoTrip;
    Series decodedTrip;
    std::vector<Series> trips(questions.size());
    for (int round = 0; round < settings.rounds; ++round) {
        echoTrip.add(roundTrip(echo, settings.seconds));
        for (std::size_t i = 0; i < questions.size(); ++i)
            trips[i].add(roundTrip(questions[i].target, settings.seconds));
        decodedTrip.add(
            roundTrip(plain, settings.seconds, [](std::string_view body) { decodedMatches(decodedReply(body)); }));
    }
    printHeader("Answers of " + withThousands(forms) + " forms, " + withThousands(plain.replySize) + " bytes");
    printReference("echo, one hop", echoTrip, "us");
    for (std::size_t i = 0; i < questions.size(); ++i) printRow(questions[i].name, trips[i], "us", echoTrip, goal);
    printRow(questions.front().name + ", decoded into trees", decodedTrip, "us", echoTrip);
    std::fflush(stdout);
}

void measureAnswers(const Settings& settings, const std::string& directory) {
    const std::string fewRoot = directory + "/few";
    const std::string manyRoot = directory + "/many";
    for (const auto& [root, plugIns] : {std::pair{fewRoot, fewForms}, {manyRoot, manyForms}}) {
        layOut(root, plugIns);
        annotate(root, plugIns);
    }
    Daemon few(settings.daemon, fewRoot);
    Daemon many(settings.daemon, manyRoot);
    measureAnswer(settings, directory, fewForms,
                  {ask(few, fewForms, "match without rules", {}),
                   ask(few, fewForms, "match with a rule that all fulfil", everyRule()),
                   ask(many, fewForms, "match with two rules, among " + withThousands(manyForms), groupRules())},
                  atMost(2.5));
    measureAnswer(settings, directory, manyForms,
                  {ask(many, manyForms, "match without rules", {}),
                   ask(many, manyForms, "match with a rule that all fulfil", everyRule())},
                  atMost(4));
}

/// What one item takes at one of the sizes, in nanoseconds.
struct Proportion {
    Series reference;
    Series measured;
};

void printProportions(const std::string& name, const std::string& referenceName, const std::vector<Proportion>& each,
                      bool hasGoal = true) {
    const double smallest = each.front().measured.over(each.front().reference).median();
    for (std::size_t i = 0; i < each.size(); ++i) {
        const std::string size = withThousands(sizes[i]) + ": ";
        printReference(size + referenceName, each[i].reference, "ns");
        printRow(size + name, each[i].measured, "ns", each[i].reference,
                 hasGoal && i + 1 == each.size() ? atMost(smallest * proportionate) : Goal());
    }
}

void measureSelection(const Settings& settings, const std::string& directory) {
    struct Size {
        Size(const Settings& settings, const std::string& directory, std::size_t count)
            : plugIns(count), bench(settings.self, directory + "/" + std::to_string(count), count) {}

        std::size_t plugIns;
        SelectionBench bench;
        Series evaluated{};
        Series selected{};
        Series selectedAgain{};
        Proportion withoutRules{};
        Proportion allInTurn{};
    };
    std::list<Size> all;
    for (const std::size_t size : sizes) all.emplace_back(settings, directory, size);
    for (int round = 0; round < settings.rounds; ++round) {
        for (auto& size : all) {
            const auto measure = [&](SelectionTask task) { return size.bench.measure(task, settings.seconds); };
            size.evaluated.add(measure(SelectionTask::evaluate));
            size.selected.add(measure(SelectionTask::selectInTurn));
            size.selectedAgain.add(measure(SelectionTask::selectAgain));
            const double each = 1e3 / static_cast<double>(size.plugIns);
            size.withoutRules.reference.add(measure(SelectionTask::gather) * each);
            size.withoutRules.measured.add(measure(SelectionTask::everything) * each);
            size.allInTurn.reference = size.withoutRules.reference;
            size.allInTurn.measured.add(measure(SelectionTask::allInTurn) * each);
        }
    }
    printHeader("Selection of 20 by point, version and attribute");
    const Size* smaller = nullptr;
    std::vector<Proportion> withoutRules;
    std::vector<Proportion> allInTurn;
    for (const auto& size : all) {
        const std::string among = "among " + withThousands(size.plugIns) + ": ";
        printReference(among + "every record asked", size.evaluated, "us");
        printRow(among + "selected", size.selected, "us", size.evaluated,
                 size.plugIns == 10'000 ? atMost(0.25) : Goal());
        printRow(among + "the same question again", size.selectedAgain, "us", size.evaluated);
        if (smaller != nullptr) {
            const Goal goal = size.plugIns == 100'000 ? atMost(1.3) : Goal();
            printRow(among + "selected, beside a tenth of them", size.selected, "us", smaller->selected, goal);
            printRow(among + "again, beside a tenth of them", size.selectedAgain, "us", smaller->selectedAgain, goal);
        }
        smaller = &size;
        withoutRules.push_back(size.withoutRules);
        allInTurn.push_back(size.allInTurn);
    }
    printHeader("Without rules, for each plug-in");
    printProportions("all records walked", "known records put into a set", withoutRules);
    printProportions("all records walked, new questions", "known records put into a set", allInTurn, false);
    std::fflush(stdout);
}

void measureReduction(const Settings& settings) {
    using namespace std::string_literals;
    using Facts = zbd::SameIdentifierReduction::Facts;
    struct Shape {
        const char* name;
        std::uint64_t flags;
        std::pair<std::string, std::string> (*candidate)(std::size_t number); // identifier and version
    };
    const std::array shapes{
        Shape{"an identifier each", 0,
              [](std::size_t i) { return std::pair(plugInIdentifier(std::to_string(i)), "1.0"s); }},
        Shape{"two versions of each identifier", 0,
              [](std::size_t i) {
                  return std::pair(plugInIdentifier(std::to_string(i / 2)), "1." + std::to_string(i % 2));
              }},
        Shape{"all versions of one identifier", zembra::ZBDiscoverAllVersions,
              [](std::size_t i) { return std::pair(plugInIdentifier(""), "1." + std::to_string(i)); }},
    };
    const MutableDictionary form{{zembra::formKey::version, "1.0"}};
    printHeader("Reduction to one for each identifier, for each answer");
    for (const Shape& shape : shapes) {
        std::vector<Proportion> each(sizes.size());
        for (int round = 0; round < settings.rounds; ++round) {
            for (std::size_t i = 0; i < sizes.size(); ++i) {
                std::vector<std::pair<std::string, std::string>> candidates;
                std::vector<std::string> names;
                for (std::size_t number = 0; number < sizes[i]; ++number) {
                    candidates.push_back(shape.candidate(number));
                    names.push_back(candidates.back().first + candidates.back().second);
                }
                const double nanoseconds = 1e3 / static_cast<double>(sizes[i]);
                each[i].reference.add(nanoseconds * meanMicroseconds(settings.seconds, [&] {
                                          const std::unordered_set<std::string> set(names.begin(), names.end());
                                          if (set.size() != names.size()) fail("two candidates are one");
                                      }));
                each[i].measured.add(nanoseconds * meanMicroseconds(settings.seconds, [&] {
                                         zbd::SameIdentifierReduction reduction(shape.flags);
                                         for (const auto& [identifier, version] : candidates) {
                                             const Facts candidate{std::string_view(identifier), version};
                                             if (reduction.admit(candidate)) reduction.add(candidate, form);
                                         }
                                         if (reduction.takeForms().empty()) fail("nothing is left");
                                     }));
            }
        }
        printProportions(shape.name, "names put into a set", each);
    }
    std::fflush(stdout);
}

/// Kilobytes of the process that are in memory.
double residentMemory(const Process& process) {
    std::ifstream status("/proc/" + std::to_string(process.pid()) + "/status");
    for (std::string line; std::getline(status, line);) {
        if (line.starts_with("VmRSS:")) return std::stod(line.substr(line.find(':') + 1));
    }
    fail("no VmRSS");
}

/// A daemon that was started and answered its first request.
struct Started {
    Started(const Settings& settings, const std::string& root, std::string_view type, const Dictionary& fields,
            const ServiceManager& manager)
        : begin(secondsNow()), daemon(settings.daemon, root, manager) {
        daemon.ask(type, fields);
        milliseconds = (secondsNow() - begin) * 1e3;
    }

    double begin;
    Daemon daemon;
    double milliseconds = 0;
};

void measureStartAndMemory(const Settings& settings, const std::string& directory) {
    const std::string root = directory + "/start";
    const std::string emptyRoot = directory + "/empty";
    std::filesystem::create_directories(emptyRoot);
    const std::string first = layOut(root, manyBundles);
    // To register what is registered already is answered when the registry's thread has done all that waited.
    const Dictionary settle{{key::paths, Array{Value(first)}}};
    UUID uuid;
    const ServiceManager none;
    ServiceManager manager(directory + "/manager");
    {
        Daemon daemon(settings.daemon, root, manager);
        uuid = uuidOf(*decodedMatches(daemon.ask(requestType::match)).array()->begin());
        daemon.ask(requestType::add, settle);
        manager.receive(daemon.process());
    }
    Series tables;
    Series found;
    Series matched;
    Series looked;
    Series empty;
    Series installed;
    Series cached;
    for (int round = 0; round < settings.rounds; ++round) {
        tables.add(readRegistryTables(root, manyBundles));
        {
            Started started(settings, root, requestType::match, groupRules(), manager);
            matched.add(started.milliseconds);
            started.daemon.ask(requestType::add, settle);
            manager.receive(started.daemon.process());
        }
        {
            // It knows nothing of the watch, and what was handed over holds no longer.
            Started started(settings, root, requestType::match, groupRules(), none);
            looked.add(started.milliseconds);
            started.daemon.ask(requestType::add, settle);
        }
        {
            Started started(settings, root, requestType::find, {{key::uuids, uuid}}, manager);
            found.add(started.milliseconds);
            started.daemon.ask(requestType::add, settle);
            manager.receive(started.daemon.process());
            installed.add(residentMemory(started.daemon.process()));
            if (decodedMatches(started.daemon.ask(requestType::match)).array()->size() != manyBundles)
                fail("some plug-ins are missing");
            cached.add(residentMemory(started.daemon.process()));
        }
        Started started(settings, emptyRoot, requestType::match, {}, none);
        empty.add(residentMemory(started.daemon.process()));
    }
    printHeader("From start to first answer, " + withThousands(manyBundles) + " bundles");
    printReference("every row of the registry's tables read", tables, "ms");
    printRow("find by UUID", found, "ms", tables, atMost(3));
    printRow("match of 20 by rules", matched, "ms", tables, atMost(3));
    printRow("the same when every bundle has to be looked at", looked, "ms", tables);
    printHeader("Resident memory");
    const double each = 1.0 / static_cast<double>(manyBundles);
    printFigure("daemon without plug-ins", empty, "KB");
    printFigure("for each plug-in, one of them found", installed.minus(empty).times(each), "KB");
    printFigure("for each plug-in, all matched once", cached.minus(empty).times(each), "KB", atMost(6));
    std::fflush(stdout);
}

} // namespace

int main(int argc, char** argv) {
    const std::vector<std::string> arguments(argv, argv + argc);
    if (arguments.size() == 4 && arguments[1] == "echo") EchoServer(arguments[2], std::stoul(arguments[3])).run();
    if (arguments.size() == 3 && arguments[1] == "selection") SelectionProcess(std::stoi(arguments[2])).run();
    const Settings settings = settingsFrom(arguments);
    const ScratchDirectory scratch;
    printMachine(settings);
    runOnOneCPU();
    std::printf("\nAll processes on one CPU\n");
    measureAnswers(settings, scratch.path());
    measureSelection(settings, scratch.path());
    measureReduction(settings);
    measureStartAndMemory(settings, scratch.path());
    return 0;
}
