#pragma once

#include "Zembra/ZBManifest.h"
#include "Zembra/ZBProtocol.h"
#include "bench/Bundles.h"
#include "bench/Process.h"
#include "bench/Timing.h"
#include "platform/linux/Descriptor.h"
#include "platform/linux/LinuxPlatform.h"
#include "zbd/ZBDServer.h"

#include <fcntl.h>
#include <memory>
#include <optional>
#include <string>
#include <sys/socket.h>
#include <utility>
#include <vector>

/// Selection by rules, measured inside a process that has the daemon's registry, database and records, but serves
/// nobody: over the socket the answer would cost more than its selection.
namespace bench {

using platform::linux_::Descriptor;

enum class SelectionTask {
    selectInTurn, // the questions one after the other; more of them than the registry keeps answers of
    selectAgain,  // one question again and again
    evaluate,     // the same questions in turn, asked of every record
    everything,   // no rules
    allInTurn,    // questions that all fulfil, one after the other; more of them than the registry keeps answers of
    gather,       // the records that are known put into a set, which is a plain way to the answer without rules
};

/// Installed plug-ins of twenty extension points. Each question asks for one point, a version from 2 on and one value
/// of an attribute that the points share, and has twenty answers however many plug-ins are installed.
class SelectionQuestions {
public:
    static constexpr std::size_t answers = 20;

    static void layOut(const std::string& root, std::size_t plugIns) {
        namespace manifest = zembra::manifest;
        std::string application;
        for (std::size_t i = 0; i < plugIns; ++i) {
            const std::string name = "Bench" + std::to_string(i);
            if (i % plugInsPerApplication == 0) application = writeApplication(root, name);
            const std::size_t number = i / points; // within its point
            const bool isCurrent = number % groupSize < answers;
            writePlugIn(application, name,
                        {.attributes = {{manifest::pointName, pointName(i % points)},
                                        {manifest::version, isCurrent ? "2.1" : "1.9"},
                                        {groupKey, groupName(number / groupSize)}},
                         .extension = {{manifest::protocol, manifest::dataProtocol}}}); // so none needs a container
        }
    }

    /// One for each point.
    static std::vector<Dictionary> all() {
        std::vector<Dictionary> questions;
        for (std::size_t point = 0; point < points; ++point) {
            questions.push_back({{zembra::manifest::pointName, pointName(point)},
                                 {zembra::manifest::version, ">=2"},
                                 {groupKey, groupName(0)}});
        }
        return questions;
    }

    /// Different ones that all plug-ins fulfil.
    static std::vector<Dictionary> forAll() {
        std::vector<Value> anyPoint;
        for (std::size_t point = 0; point < points; ++point) anyPoint.emplace_back(pointName(point));
        std::vector<Dictionary> questions;
        for (std::size_t i = 0; i < 20; ++i) {
            std::vector<Value> patterns = anyPoint;
            patterns.emplace_back(pointName(points + i));
            questions.push_back({{zembra::manifest::pointName, platform::Array(std::move(patterns))}});
        }
        return questions;
    }

private:
    static constexpr std::size_t points = 20;
    static constexpr std::size_t groupSize = 25; // plug-ins of a point with one value of the attribute
    static constexpr std::size_t plugInsPerApplication = 100;
    static constexpr std::string_view groupKey = "SampleGroup";

    static std::string pointName(std::size_t point) { return "org.example.bench-service-" + std::to_string(point); }
    static std::string groupName(std::size_t group) { return "group " + std::to_string(group); }
};

/// The process: takes tasks from the descriptor until that is closed.
class SelectionProcess {
public:
    explicit SelectionProcess(int tasks) : _tasks(tasks) {
        if (!_server) fail("no server");
        const auto found = _server->findPlugIns(std::nullopt);
        if (!found) fail("the registry does not answer");
        _records.assign(found->begin(), found->end());
    }

    [[noreturn]] void run() {
        std::pair<SelectionTask, double> task;
        while (recv(_tasks, &task, sizeof task, 0) == sizeof task) {
            const double microseconds = perform(task.first, task.second);
            if (send(_tasks, &microseconds, sizeof microseconds, MSG_NOSIGNAL) < 0) break;
        }
        std::_Exit(0); // the platform's threads still run
    }

private:
    double perform(SelectionTask task, double seconds) {
        switch (task) {
        case SelectionTask::selectInTurn: return meanMicroseconds(seconds, [&] { select(nextQuestion()); });
        case SelectionTask::selectAgain: return meanMicroseconds(seconds, [&] { select(_questions.front()); });
        case SelectionTask::evaluate: return meanMicroseconds(seconds, [&] { evaluate(nextQuestion()); });
        case SelectionTask::everything: return meanMicroseconds(seconds, [&] { walk(std::nullopt); });
        case SelectionTask::allInTurn:
            return meanMicroseconds(seconds, [&] { walk(_questionsForAll[_asked++ % _questionsForAll.size()]); });
        case SelectionTask::gather:
            return meanMicroseconds(seconds, [&] {
                const zbd::ZBDPlugInSet gathered(_records.begin(), _records.end());
                if (gathered.size() != _records.size()) fail("two records are one");
            });
        }
        return 0;
    }

    const Dictionary& nextQuestion() { return _questions[_asked++ % _questions.size()]; }

    /// What the daemon does: candidates from the registry's indexes, then the rules themselves.
    void select(const Dictionary& rules) {
        std::size_t count = 0;
        const auto candidates = _server->findPlugIns(rules);
        for (const auto& candidate : *candidates) count += candidate->match(rules) ? 1 : 0;
        if (count != SelectionQuestions::answers) fail("another number of answers");
    }

    /// What the daemon does when there is nothing to compare.
    void walk(const std::optional<Dictionary>& rules) {
        std::size_t count = 0;
        const auto candidates = _server->findPlugIns(rules);
        for (const auto& candidate : *candidates) {
            if (!candidate->keptForm() && (candidate->onSystemVolume() || candidate->isContained())) ++count;
        }
        if (count != _records.size()) fail("some plug-ins went");
    }

    void evaluate(const Dictionary& rules) {
        std::size_t count = 0;
        for (const auto& record : _records) count += record->match(rules) ? 1 : 0;
        if (count != SelectionQuestions::answers) fail("another number of answers");
    }

    int _tasks;
    platform::linux_::LinuxPlatform _services;
    std::shared_ptr<zbd::ZBDServer> _server =
        zbd::ZBDServer::initForService(_services.start(), zembra::serviceName, std::nullopt);
    std::vector<zbd::ZBDPlugInRef> _records;
    const std::vector<Dictionary> _questions = SelectionQuestions::all();
    const std::vector<Dictionary> _questionsForAll = SelectionQuestions::forAll();
    std::size_t _asked = 0;
};

/// One such process over a number of plug-ins of its own.
class SelectionBench {
public:
    /// `self` is this program, which knows the role "selection".
    SelectionBench(const std::string& self, const std::string& root, std::size_t plugIns) {
        SelectionQuestions::layOut(root, plugIns);
        int ends[2];
        if (socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends) != 0) failSystem("socketpair");
        _tasks = Descriptor(ends[0]);
        const Descriptor theirs(ends[1]);
        fcntl(theirs.get(), F_SETFD, 0);
        _process.emplace(std::vector<std::string>{self, "selection", std::to_string(theirs.get())},
                         std::vector<std::string>{"NORDANE_ROOT=" + root, "NORDANE_LOG=stderr"});
    }

    double measure(SelectionTask task, double seconds) {
        const std::pair request{task, seconds};
        double microseconds = 0;
        if (send(_tasks.get(), &request, sizeof request, MSG_NOSIGNAL) < 0) failSystem("send");
        if (recv(_tasks.get(), &microseconds, sizeof microseconds, 0) != sizeof microseconds)
            fail("a process for selection ended");
        return microseconds;
    }

private:
    std::optional<Process> _process;
    Descriptor _tasks; // closed first: it ends the process
};

} // namespace bench
