#include "Context.h"

#include "Examples.h"
#include "ProgressLine.h"
#include "SafeText.h"
#include "Terminal.h"
#include "Texts.h"

#include "contacts/database/DaemonMemory.h"
#include "contacts/database/DamagedDatabase.h"
#include "contacts/database/History.h"
#include "daemon/InstanceLock.h"
#include "foundation/Preferences.h"

#include <cmath>
#include <fmt/format.h>
#include <iostream>
#include <unistd.h>

namespace rolvane::cli {

struct Context::Impl {
    RunLoop* loop = nullptr;
    std::unique_ptr<DaemonLink> bus;
    bool opened = false;
};

Context::Context() : _impl(std::make_unique<Impl>()) {}

Context::~Context() {
    if (_impl->opened) CXRolvane::closeShared();
}

RunLoop& Context::loop() {
    if (!_impl->loop) _impl->loop = &RunLoop::current();
    return *_impl->loop;
}

DaemonLink& Context::bus() {
    if (!_impl->bus)
        _impl->bus = std::make_unique<DaemonLink>(
            loop(), [] { return InstanceLock::holderListensAt(InstanceLock::defaultPath()); });
    return *_impl->bus;
}

CXRolvane& Context::database() {
    if (!_impl->opened) {
        CXRolvane::Options options;
        options.program = "rolvane";
        options.distributed = &bus();
        requireKnownDatabase(options.path, Preferences::shared());
        CXRolvane::configureShared(options);
        CXHistory(CXRolvane::sharedRolvane()).savesAreOne(command);
        _impl->opened = true;
    }
    return CXRolvane::sharedRolvane();
}

void Context::print(const nlohmann::ordered_json& data) {
    std::cout << shownJson(data.dump(2, ' ', false, nlohmann::json::error_handler_t::replace)) << "\n";
}

void Context::line(const std::string& text) {
    std::cout << shownText(text) << "\n";
}

void Context::row(const std::string& label, const std::string& text, size_t column) {
    line(label + std::string(column - std::min(column - 1, columnsOf(label)), ' ') + text);
}

void Context::say(const std::string& text) {
    if (!quiet) std::cerr << shownText(text) << "\n";
}

void Context::warn(const std::string& text) {
    std::cerr << shownText(text) << "\n";
}
bool Context::talkIsTerminal() const {
    return ::isatty(STDERR_FILENO) == 1;
}
bool Context::dataIsTerminal() const {
    return ::isatty(STDOUT_FILENO) == 1;
}

size_t Context::dataColumns() const {
    return terminalColumns(STDOUT_FILENO);
}

ProgressBar::ProgressBar(Context& context, std::string label) : _context(context), _label(std::move(label)) {}

ProgressBar::~ProgressBar() {
    if (_open) std::cerr << "\n";
}

void ProgressBar::update(double fraction, const std::string& note) {
    if (_context.quiet) return;
    const double clamped = std::isfinite(fraction) ? std::min(1.0, std::max(0.0, fraction)) : 0.0;
    const int percent = static_cast<int>(clamped * 100);
    if (_context.talkIsTerminal()) {
        if (percent == _shown) return;
        _shown = percent;
        std::cerr << "\r" << progressLine(_label, percent, shownLine(note), terminalColumns(STDERR_FILENO)) << "\033[K"
                  << std::flush;
        _open = true;
        return;
    }
    if (percent / 10 == _shown) return;
    _shown = percent / 10;
    std::cerr << fmt::format("{} {}% {}", _label, percent, note) << "\n";
}

namespace {

// "group add"; the program's own name is no part of it.
std::string pathOf(const CLI::App& command) {
    const CLI::App* parent = command.get_parent();
    const bool below = parent && parent->get_parent();
    return (below ? pathOf(*parent) + " " : "") + command.get_name();
}

} // namespace

void translateOptions(CLI::App& command) {
    for (CLI::Option* option : command.get_options()) {
        option->description(translated(option->get_description().c_str()));
        if (option->get_group() == "Options") option->group(translated("Options"));
    }
    for (CLI::App* group : command.get_subcommands([](const CLI::App* each) { return each->get_name().empty(); })) {
        group->description(translated(group->get_description().c_str()));
        translateOptions(*group);
    }
}

CLI::App* addCommand(CLI::App& parent, Context& context, const std::string& name, const std::string& description,
                     const std::function<void(CLI::App&)>& declare, std::function<void()> body) {
    CLI::App* command = parent.add_subcommand(name, translated(description.c_str()));
    command->fallthrough();
    command->footer(helpFooter(pathOf(*command)));
    command->add_flag("--json", context.json, "Print data as one JSON document");
    command->add_flag("-q,--quiet", context.quiet, "No messages but errors");
    if (declare) declare(*command);
    command->group(translated("Subcommands"));
    translateOptions(*command);
    if (body)
        command->final_callback([&context, path = pathOf(*command), body = std::move(body)] {
            // Makes the memory's directory, which --help does not need, nor an administrator's home for a store.
            if (!path.starts_with("store ")) Preferences::shared().keepElsewhere(daemonMemory());
            context.command = path;
            body();
        });
    return command;
}

} // namespace rolvane::cli
