// The mobile home is hostile ground: every application runs as the mobile user. On a device root
// laid out by the packaged snippets, with the daemon as its own user, a mobile-user process
// attacks what the daemon installs, links and stores, while a client sets a bundle, the daemon
// relaunches and a signed update installs. Starting processes as other users needs root.
#include <gmock/gmock.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <memory>
#include <thread>

#include "BusFixture.h"
#include "TestSupport.h"
#include "plist/PropertyListFormat.h"

namespace tavrix::integration {
namespace {

namespace fs = std::filesystem;
using ::testing::HasSubstr;

constexpr const char* kBehaviorID = "acme.default";
constexpr const char* kDaemonPreferences =
    "/var/mobile/Library/Preferences/com.zandor.tavrixservices.plist";

struct Attack {
    const char* name;
    // Run by /bin/sh as the mobile user, with $H the mobile home, $STATE the daemon's state
    // directory, $T the device's /tmp and $EVIL the attacker's own files; failures are expected.
    const char* script;
    // Whether the client's payloads cannot be installed while it runs (the daemon refuses them).
    bool blocksPayloads = false;
};

std::ostream& operator<<(std::ostream& out, const Attack& attack) {
    return out << attack.name;
}

// The uid and gid of name in the device's user database.
std::pair<uid_t, gid_t> userIn(const fs::path& database, const std::string& name) {
    std::unique_ptr<FILE, int (*)(FILE*)> file(std::fopen(database.c_str(), "r"), &std::fclose);
    for (passwd* entry = nullptr; file && (entry = ::fgetpwent(file.get())) != nullptr;) {
        if (name == entry->pw_name) {
            return {entry->pw_uid, entry->pw_gid};
        }
    }
    throw std::runtime_error("no user " + name + " in " + database.string());
}

// The attack repeated on a thread of its own until the object goes.
struct RepeatedAttack {
    ~RepeatedAttack() { test::writeText(stop, ""); }  // before the thread is joined
    fs::path stop;  // the attack's loop ends once this file exists
    std::jthread loop;
};

class MobileHomeAttackTest : public BusFixture, public ::testing::WithParamInterface<Attack> {
  protected:
    void SetUp() override {
        if (::geteuid() != 0) {
            GTEST_SKIP() << "running the daemon and the attacker as other users needs root";
        }
        for (const char* tool :
             {"/usr/bin/setpriv", "/usr/bin/systemd-sysusers", "/usr/bin/systemd-tmpfiles"}) {
            if (::access(tool, X_OK) != 0) {
                GTEST_SKIP() << tool << " is missing";
            }
        }
        // The device root as the package lays it out: its users and directories made by the
        // packaged snippets, a system bundle of version 10 and a shared /tmp.
        fs::remove(at("/etc/passwd"));
        fs::remove_all(at("/var/mobile"));
        const std::string root = device().root().string();
        for (const std::vector<std::string>& command :
             {std::vector<std::string>{"/usr/bin/systemd-sysusers", "--root=" + root,
                                       TAVRIX_SYSUSERS_PATH},
              {"/usr/bin/systemd-tmpfiles", "--root=" + root, "--create", TAVRIX_TMPFILES_PATH}}) {
            CommandResult run = runCommand(command);
            ASSERT_EQ(run.status, 0) << run.output;
        }
        fs::create_directories(at("/tmp"));
        fs::permissions(at("/tmp"), fs::perms::all | fs::perms::sticky_bit);
        writeBundle(at(kSystemBundle), "10", {{"CarrierName", "System"}});
        daemon_ = userIn(at("/etc/passwd"), "tavrixservicesd");
        mobile_ = userIn(at("/etc/passwd"), "mobile");
        if (runCommand(asUser(daemon_, {"/usr/bin/test", "-x", TAVRIX_DAEMON_PATH})).status != 0) {
            GTEST_SKIP() << "the daemon's user cannot reach " << TAVRIX_DAEMON_PATH;
        }
        fs::permissions(device().base(), fs::perms::others_read | fs::perms::others_exec,
                        fs::perm_options::add);
        ASSERT_EQ(::chown(device().runtimeDirectory().c_str(), daemon_.first, daemon_.second), 0);
        daemonLaunchPrefix = asUser(daemon_, {});
        // A bundle of version 99 and a packed one whose entries reach for the daemon's state
        // directory, plus preferences the attacker would like the daemon to take.
        const fs::path evil = device().base() / "evil";
        writeBundle(evil / "Default.bundle", "99", {{"CarrierName", "PWNED"}});
        test::writeText(evil / "Default.bundle/PWNED", "x");
        const fs::path escape = device().base() / "escape";
        test::writeText(escape / "PWNED-inside", "x");
        CommandResult packed =
            runCommand({"/usr/bin/bsdtar", "-czPf", (evil / "payload.tgz").string(), "-s",
                        "|^|" + at("/var/lib/tavrixservicesd").string() + "/|", "-C",
                        escape.string(), "PWNED-inside"});
        ASSERT_EQ(packed.status, 0) << packed.output;
        ASSERT_TRUE(plist::writeFile(
            (evil / "preferences.plist").string(),
            plist::Value(plist::Dictionary{{"TavrixID", "pwned"},
                                           {"EnableSupport", true},
                                           {"NextUpdate", plist::Date{2'000'000'000.0}}})));
        CommandResult opened = runCommand({"/bin/chmod", "-R", "a+rX", evil.string()});
        ASSERT_EQ(opened.status, 0) << opened.output;
        BusFixture::SetUp();
    }

    // Once, or repeated until the file stop exists.
    CommandResult attack(const std::optional<fs::path>& stop = std::nullopt) {
        std::string script = std::string("H='") + at("/var/mobile").string() + "' STATE='" +
                             at("/var/lib/tavrixservicesd").string() + "' T='" +
                             at("/tmp").string() + "' EVIL='" +
                             (device().base() / "evil").string() + "'; " +
                             (stop ? "while [ ! -e '" + stop->string() + "' ]; do " : "") +
                             GetParam().script + (stop ? "; sleep 0.05; done" : "");
        return runCommand(asUser(mobile_, {"/bin/sh", "-c", "exec 2>/dev/null; " + script}));
    }

    // Both links are the daemon's own and lead into the user bundle of this version.
    void expectLinked(const std::string& version) {
        EXPECT_EQ(linkedVersion(), version);
        EXPECT_EQ(linkState(), "links agree");
        for (const char* link : {kBundleLink, kPreferencesLink}) {
            struct stat info {};
            ASSERT_EQ(::lstat(at(link).c_str(), &info), 0) << link;
            EXPECT_TRUE(S_ISLNK(info.st_mode)) << link;
            EXPECT_EQ(info.st_uid, daemon_.first) << link;
        }
    }

    // Nothing the daemon owns carries the attacker's marks, and its state directory holds only
    // its own regular files, none of them its preferences written through a link. (The daemon
    // may still be purging its download: what is gone by the time it is looked at is passed.)
    void expectNothingWrittenForTheAttacker() {
        std::error_code error;
        for (fs::recursive_directory_iterator entry(device().root(), error), end;
             !error && entry != end; entry.increment(error)) {
            struct stat info {};
            if (::lstat(entry->path().c_str(), &info) != 0) {
                continue;
            }
            if (entry->path().string().find("PWNED") != std::string::npos) {
                EXPECT_EQ(info.st_uid, mobile_.first) << entry->path();
            }
        }
        for (const auto& entry : fs::directory_iterator(at("/var/lib/tavrixservicesd"))) {
            struct stat info {};
            if (::lstat(entry.path().c_str(), &info) != 0) {
                continue;
            }
            EXPECT_TRUE(S_ISREG(info.st_mode)) << entry.path();
            EXPECT_EQ(info.st_uid, daemon_.first) << entry.path();
            auto stored = plist::readFile(entry.path().string());
            EXPECT_FALSE(stored && stored->find("TavrixID") != nullptr) << entry.path();
        }
    }

    std::pair<uid_t, gid_t> daemon_;
    std::pair<uid_t, gid_t> mobile_;
};

TEST_P(MobileHomeAttackTest, TheDaemonInstallsAndTrustsOnlyItsOwn) {
    attack();  // each attack is expected to fail in part
    const fs::path stop = device().base() / "evil/stop";
    auto repeated =
        std::make_unique<RepeatedAttack>(stop, std::jthread([this, stop] { attack(stop); }));

    ASSERT_TRUE(client().setTavrixID("ACME.default", pack(writeVersionedBundle("11"))));
    ASSERT_TRUE(client().setTavrixID("ACME.default", pack(writeVersionedBundle("12"))));
    const std::string payloadVersion = GetParam().blocksPayloads ? "10" : "12";
    expectLinked(payloadVersion);
    // No support the device's configuration did not give, no update date of the attacker's.
    EXPECT_EQ(device().daemonPreference("EnableSupport"), std::nullopt);
    auto next = device().daemonPreference("NextUpdate");
    EXPECT_TRUE(!next ||
                (next->asDate() && next->asDate()->secondsSinceReferenceDate < 2'000'000'000.0));
    if (GetParam().blocksPayloads) {
        const plist::Value status(client().status());
        const plist::Value* payload = status.find("LastPayload");
        ASSERT_TRUE(payload != nullptr && payload->find("Reason") != nullptr);
        EXPECT_THAT(*payload->find("Reason")->asString(), HasSubstr("could not be staged"));
    }

    ASSERT_TRUE(stopDaemon());
    client().isTavrixBundleSupported();
    expectLinked(payloadVersion);

    // The device's configuration turns support on, as root, keeping what is stored; version 13 is
    // published in a catalog the device trusts.
    auto stored = device().readDaemonPreferences();
    plist::Dictionary values =
        stored && stored->asDictionary() ? *stored->asDictionary() : plist::Dictionary();
    values.insert_or_assign("EnableSupport", true);
    device().writeDaemonPreferences(values);
    publishSigned(writeVersionedBundle("13"));
    client().checkForTavrixBundleUpdate();
    // The carrier file link follows the bundle link: both must have moved.
    EXPECT_TRUE(
        pollUntil([&] { return linkedVersion() == "13" && linkState() == "links agree"; }, 30s));
    // What is left is judged once the attacker has stopped changing it.
    repeated.reset();
    expectLinked("13");
    struct stat info {};
    ASSERT_EQ(::lstat(at(kDaemonPreferences).c_str(), &info), 0);
    EXPECT_TRUE(S_ISREG(info.st_mode));
    EXPECT_TRUE(info.st_uid == daemon_.first || info.st_uid == 0);
    EXPECT_EQ(device().daemonPreference("TavrixID"), std::optional<plist::Value>(kBehaviorID));
    next = device().daemonPreference("NextUpdate");
    ASSERT_TRUE(next && next->asDate());
    EXPECT_LT(next->asDate()->secondsSinceReferenceDate, 2'000'000'000.0);
    expectNothingWrittenForTheAttacker();
}

INSTANTIATE_TEST_SUITE_P(
    Attacks, MobileHomeAttackTest,
    ::testing::Values(
        // Swap the bundle directory for one of the attacker's, or add one beside it.
        Attack{"BundleSwap",
               "cd \"$H/Library\"; mv TavrixBundles x; mkdir -p TavrixBundles/Default.bundle; "
               "cp -r \"$EVIL/Default.bundle/.\" TavrixBundles/Default.bundle/; "
               "cp -r \"$EVIL/Default.bundle\" TavrixBundles/; "
               "ln -sfn \"$STATE\" TavrixBundles/Overlay"},
        // Replace, edit or link the daemon's preferences (before the first write too).
        Attack{"PreferencesEdit",
               "cd \"$H/Library/Preferences\"; cp \"$EVIL/preferences.plist\" mine.plist; "
               "mv -f mine.plist com.zandor.tavrixservices.plist; "
               "cp \"$EVIL/preferences.plist\" com.zandor.tavrixservices.plist; "
               "ln -sn \"$STATE/pending-install.plist\" com.zandor.tavrixservices.plist"},
        // Link the daemon's preferences into its state directory before they are first written.
        Attack{"PreferencesLink",
               "ln -sn \"$STATE/PWNED.plist\" "
               "\"$H/Library/Preferences/com.zandor.tavrixservices.plist\""},
        // Plant links where the writers put their temporary files and their lock.
        Attack{"WriterRace",
               "for d in \"$H/Library\" \"$H/Library/Preferences\"; do for n in a b c; do "
               "ln -sfn \"$STATE/pending-install.plist\" \"$d/.tavrix-write-$n\"; done; done; "
               "ln -sfn \"$STATE/x\" "
               "\"$H/Library/Preferences/.com.zandor.tavrixservices.plist.lock\"; "
               "ln -sfn \"$STATE\" \"$H/Library/.tavrix-link-Tavrix.bundle\""},
        // Take the link names before the daemon, pointing them at the attacker's bundle.
        Attack{"LinkSquat",
               "ln -sn \"$EVIL/Default.bundle\" \"$H/Library/Tavrix.bundle\"; "
               "ln -sn \"$EVIL/Default.bundle/behavior.plist\" "
               "\"$H/Library/Preferences/com.zandor.tavrix.plist\""},
        // Plant an archive, or a link, at the payload's fixed staging path.
        Attack{"StagingFile", "cp \"$EVIL/payload.tgz\" \"$T/behaviorbundle_zipped.tgz\"", true},
        Attack{"StagingLink", "ln -sn \"$STATE/PWNED-link\" \"$T/behaviorbundle_zipped.tgz\"",
               true}),
    [](const ::testing::TestParamInfo<Attack>& info) { return std::string(info.param.name); });

}  // namespace
}  // namespace tavrix::integration
