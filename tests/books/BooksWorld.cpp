#include "BooksWorld.h"

#include "foundation/Paths.h"
#include "server/LoopbackPort.h"

#include <algorithm>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <pwd.h>
#include <stdexcept>
#include <unistd.h>

namespace rolvane {
namespace {

namespace fs = std::filesystem;

constexpr const char* kServerUser = "www-data";

std::string between(const std::string& text, const std::string& start, const std::string& end, size_t from = 0) {
    const size_t at = text.find(start, from);
    if (at == std::string::npos) return {};
    const size_t begin = at + start.size();
    const size_t stop = text.find(end, begin);
    return stop == std::string::npos ? std::string() : text.substr(begin, stop - begin);
}

std::string lower(std::string text) {
    for (char& c : text)
        if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
    return text;
}

// The body of an answer in chunks; false where it breaks off.
bool takeChunks(const std::string& text, std::string& out) {
    for (size_t at = 0; at < text.size();) {
        const size_t line = text.find("\r\n", at);
        if (line == std::string::npos) return false;
        const size_t length = std::stoul(text.substr(at, line - at), nullptr, 16);
        if (length == 0) return true;
        if (line + 2 + length > text.size()) return false;
        out += text.substr(line + 2, length);
        at = line + 2 + length + 2;
    }
    return false;
}

} // namespace

// Answers ----------------------------------------------------------------------------------------------------------

std::string BookResponse::property(const std::string& element) const {
    const size_t at = text.find("<" + element);
    if (at == std::string::npos) return {};
    return between(text, ">", "</" + element.substr(0, element.find(' ')) + ">", at);
}

bool BookResponse::has(const std::string& element) const {
    return text.find("<" + element) != std::string::npos;
}

std::string BookResponse::card() const {
    std::string card = property("C:address-data");
    for (const auto& [from, to] : {std::pair("&#13;", "\r"), std::pair("&lt;", "<"), std::pair("&gt;", ">"),
                                   std::pair("&quot;", "\""), std::pair("&amp;", "&")})
        for (size_t at = 0; (at = card.find(from, at)) != std::string::npos; at += 1)
            card.replace(at, std::string(from).size(), to);
    return card;
}

std::string BookAnswer::header(const std::string& name) const {
    const std::string all = lower(headers);
    const size_t at = all.find("\r\n" + lower(name) + ": ");
    return at == std::string::npos ? std::string() : between(headers, ": ", "\r\n", at);
}

std::vector<BookResponse> BookAnswer::responses() const {
    std::vector<BookResponse> all;
    for (size_t at = 0; (at = body.find("<D:response", at)) != std::string::npos; ++at) {
        BookResponse one;
        one.text = between(body, "<D:response", "</D:response>", at);
        one.href = between(one.text, "<D:href>", "</D:href>");
        if (one.text.find("<D:propstat>") == std::string::npos)
            one.status = std::atoi(between(one.text, "HTTP/1.1 ", " ").c_str());
        all.push_back(std::move(one));
    }
    return all;
}

const BookResponse* BookAnswer::find(const std::vector<BookResponse>& all, const std::string& href) const {
    const auto found = std::find_if(all.begin(), all.end(), [&](const BookResponse& r) { return r.href == href; });
    return found == all.end() ? nullptr : &*found;
}

std::string BookAnswer::syncToken() const {
    const size_t behind = std::min(body.rfind("</D:response>"), body.size());
    return between(body, "<D:sync-token>", "</D:sync-token>", behind == body.size() ? 0 : behind);
}

std::string BookAnswer::precondition() const {
    return RawAnswer{status, headers, body}.precondition();
}

// The world --------------------------------------------------------------------------------------------------------

BooksWorld::BooksWorld(Options options) : _port(LoopbackPort::choose()), _isSanitized(options.sanitized) {
    fs::create_directory(_directory / "run");
    CXRolvane::Options database;
    database.path = this->database();
    database.program = "test";
    _rolvane = std::make_unique<CXRolvane>(database);
    for (const std::string& device : options.devices) {
        test::ChildProcess hash({"htpasswd", "-n", "-b", "-s", device, rawPasswordOf(device)});
        hash.closeInput();
        if (!hash.wait()) throw std::runtime_error("htpasswd does not end");
        std::ofstream(_directory / "devices", std::ios::app) << hash.output();
    }
    const std::string modules = "/usr/lib/apache2/modules";
    std::ofstream file(_directory / "httpd.conf");
    file << "ServerRoot \"" << _directory.path() << "\"\nDefaultRuntimeDir \"" << path("run") << "\"\nPidFile \""
         << path("run/httpd.pid") << "\"\nMutex \"file:" << path("run") << "\" default\nServerName localhost\n"
         << "Listen 127.0.0.1:" << _port << "\nErrorLog \"" << path("error.log") << "\"\n";
    for (const char* name :
         {"mpm_event", "authn_core", "authn_file", "authz_core", "authz_user", "auth_basic", "dav", "alias"})
        file << "LoadModule " << name << "_module " << modules << "/mod_" << name << ".so\n";
#ifdef ROLVANE_SANITIZED_CARDBOOK
    const std::string module = _isSanitized ? ROLVANE_SANITIZED_CARDBOOK : ROLVANE_CARDBOOK;
#else
    const std::string module = ROLVANE_CARDBOOK; // all else has them
#endif
    file << "LoadModule cardbook_module " << module << "\n";
    if (geteuid() == 0) file << "User " << kServerUser << "\nGroup " << kServerUser << "\n";
    file << "StartServers 1\nServerLimit 1\nThreadsPerChild 8\nMaxRequestWorkers 8\n"
         << "CardBookDatabase \"" << this->database()
         << "\"\nRedirectMatch 301 \"^/\\.well-known/carddav/?$\" /books/\n"
         << options.directives << "\n<Location \"/books\">\nDav cardbook\n";
    if (options.signedIn)
        file << "AuthType Basic\nAuthName books\nAuthBasicProvider file\nAuthUserFile \"" << path("devices")
             << "\"\nRequire valid-user\n";
    else
        file << "Require all granted\n";
    file << "</Location>\n";
    file.close();
    if (const passwd* user = geteuid() == 0 ? getpwnam(kServerUser) : nullptr) {
        fs::permissions(_directory.path(), fs::perms::owner_all);
        for (const auto& each : fs::recursive_directory_iterator(_directory.path()))
            if (chown(each.path().c_str(), user->pw_uid, user->pw_gid) != 0) throw std::runtime_error("no chown");
        if (chown(_directory.path().c_str(), user->pw_uid, user->pw_gid) != 0) throw std::runtime_error("no chown");
    }
    start();
}

BooksWorld::~BooksWorld() {
    stop(false);
}

void BooksWorld::start() {
    test::ChildProcess::Options options{.arguments = {"/usr/sbin/apache2", "-f", path("httpd.conf"), "-DFOREGROUND"},
                                        .directory = "/"};
#ifdef ROLVANE_SANITIZED_CARDBOOK
    // httpd was itself built without sanitizers, so it loads them before everything else.
    if (_isSanitized)
        options.environment =
            std::vector<std::string>{"PATH=/usr/bin:/bin", "LD_PRELOAD=" ROLVANE_SANITIZERS,
                                     "ASAN_OPTIONS=detect_leaks=0", "UBSAN_OPTIONS=print_stacktrace=1"};
#endif
    _process = std::make_unique<test::ChildProcess>(std::move(options));
    _process->closeInput();
    constexpr auto kPatience = std::chrono::seconds(20);
    const auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (_process->running() && !fs::exists(path("run/httpd.pid")) && std::chrono::steady_clock::now() < deadline)
        usleep(2000);
    if (!_process->running() || !LoopbackPort::answers(_port, false, kPatience))
        throw std::runtime_error("httpd did not start: " + _process->errors() + log());
}

void BooksWorld::stop(bool kill) {
    if (!_process) return;
    if (kill) { // the workers first: they would go on without their parent
        _process->signal(SIGSTOP);
        killWorkers();
    }
    _process->signal(kill ? SIGKILL : SIGTERM);
    _process->wait(20);
    _process.reset();
}

void BooksWorld::killWorkers() const {
    const std::string pid = std::to_string(_process->pid());
    std::ifstream children("/proc/" + pid + "/task/" + pid + "/children");
    for (pid_t worker = 0; children >> worker;) ::kill(worker, SIGKILL);
}

void BooksWorld::restart(bool kill) {
    stop(kill);
    std::error_code ignored;
    fs::remove(path("run/httpd.pid"), ignored);
    start();
}

std::string BooksWorld::log() const {
    std::ifstream file(path("error.log"));
    return std::string(std::istreambuf_iterator<char>(file), {});
}

std::string BooksWorld::uuidOf(const CXRecordRef& record) {
    return std::string(cxUUIDPart(record->uniqueId()));
}

CXPersonRef BooksWorld::addPerson(const std::string& first, const std::string& last, const Dictionary& more) {
    Dictionary properties = more.mutableCopy();
    properties.set(kCXFirstNameProperty, first);
    properties.set(kCXLastNameProperty, last);
    CXPersonRef person = CXPerson::personFromDictionary(properties, _rolvane.get(), false, false);
    _rolvane->save();
    return person;
}

CXGroupRef BooksWorld::addGroup(const std::string& name, const std::vector<CXPersonRef>& members) {
    CXGroupRef group = CXGroup::create();
    group->setValue(name, kCXGroupNameProperty);
    _rolvane->addRecord(group);
    for (const CXPersonRef& member : members) group->addMember(member);
    _rolvane->save();
    return group;
}

CXSubscriptionRef BooksWorld::addSubscription(const std::string& location, bool writable, const std::string& first) {
    CXSubscriptionRef subscription = CXSubscription::create(RemoteLocation(location));
    _rolvane->addRecord(subscription);
    if (writable) {
        CXMutableMultiValue writers;
        writers.addValue("me", "");
        _rolvane->allGroupForRemoteLocation(RemoteLocation(location))
            ->setValue(writers.toValue(), kCXReadWriteSharingACLProperty);
    }
    CXMutableMultiValue where;
    where.addValue(location, kCXSubscribeLabel);
    const CXPersonRef person = CXPerson::initWithUniqueId(makeUniqueId(kCXSubscribedPersonTable));
    person->resetWithDictionary({{kCXFirstNameProperty, first}, {kCXRemoteLocationProperty, where.toValue()}}, false,
                                false);
    _rolvane->addRecord(person);
    _rolvane->save();
    return subscription;
}

BookAnswer BooksWorld::ask(const std::string& method, const std::string& path, const Headers& headers,
                           const std::string& body, const std::string& device) const {
    Headers all = headers;
    for (auto& [name, value] : all)
        if (name == "Destination") value.insert(0, "http://localhost:" + std::to_string(_port));
    if (std::none_of(all.begin(), all.end(), [](const auto& h) { return h.first == "Host"; }))
        all.emplace_back("Host", "localhost:" + std::to_string(_port));
    const RawAnswer raw = rawRequest(_port, {device, method, path, all, body});
    BookAnswer answer{raw.status, raw.headers, {}, true};
    if (lower(raw.headers).find("transfer-encoding: chunked") != std::string::npos)
        answer.whole = takeChunks(raw.body, answer.body);
    else
        answer.body = raw.body;
    return answer;
}

BookAnswer BooksWorld::propfind(const std::string& path, int depth, const std::string& properties) const {
    return ask("PROPFIND", path, {{"Depth", std::to_string(depth)}, {"Content-Type", "application/xml"}},
               "<D:propfind xmlns:D=\"DAV:\" xmlns:C=\"urn:ietf:params:xml:ns:carddav\" "
               "xmlns:S=\"http://calendarserver.org/ns/\"><D:prop>" +
                   properties + "</D:prop></D:propfind>");
}

BookAnswer BooksWorld::report(const std::string& path, const std::string& body) const {
    return ask("REPORT", path, {{"Depth", "0"}, {"Content-Type", "application/xml"}}, body);
}

BookAnswer BooksWorld::sync(const std::string& path, const std::string& token, const std::string& more) const {
    return report(path,
                  "<D:sync-collection xmlns:D=\"DAV:\" xmlns:C=\"urn:ietf:params:xml:ns:carddav\"><D:sync-token>" +
                      token + "</D:sync-token><D:sync-level>1</D:sync-level>" + more +
                      "<D:prop><D:getetag/></D:prop></D:sync-collection>");
}

BookAnswer BooksWorld::multiget(const std::string& path, const std::vector<std::string>& hrefs,
                                const std::string& data) const {
    std::string body = "<C:addressbook-multiget xmlns:D=\"DAV:\" xmlns:C=\"urn:ietf:params:xml:ns:carddav\"><D:prop>"
                       "<D:getetag/>" +
                       data + "</D:prop>";
    for (const std::string& href : hrefs) body += "<D:href>" + href + "</D:href>";
    return report(path, body + "</C:addressbook-multiget>");
}

BookAnswer BooksWorld::put(const std::string& path, const std::string& card, const Headers& headers,
                           const std::string& device) const {
    Headers all = headers;
    all.emplace_back("Content-Type", "text/vcard; charset=utf-8");
    return ask("PUT", path, all, card, device);
}

std::string cardOf(const std::string& uid, const std::string& first, const std::string& last,
                   const std::string& lines) {
    return "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:" + uid + "\r\nFN:" + first + " " + last + "\r\nN:" + last + ";" + first +
           ";;;\r\n" + lines + "END:VCARD\r\n";
}

} // namespace rolvane
