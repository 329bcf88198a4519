#include "platform/catalog/AppCatalog.h"
#include "platform/catalog/PlugInBundleReader.h"
#include "platform/catalog/PlugInDeclarations.h"

#include <gtest/gtest.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <functional>
#include <mutex>
#include <set>
#include <thread>

#include "platform/file/PathFacts.h"
#include "platform/plist/PropertyList.h"
#include "support/LogCapture.h"
#include "support/TempDir.h"

namespace {

namespace fs = std::filesystem;
using qm::AppCatalog;
using qm::PlugInRecordPtr;
using qm::Value;
using qmtest::eventually;
using qmtest::LogCapture;
using qmtest::writePlist;

using Dict = qm::Dictionary;

// A plug-in bundle's Info: new style unless told, with an executable unless
// it is a data plug-in.
Dict plugInInfo(const std::string& identifier, const std::string& point, bool oldStyle = false,
                bool executable = true) {
    Dict info{{"MRBundleIdentifier", Value(identifier)}, {"MRBundleName", Value(identifier + " name")}};
    if (oldStyle) {
        info.set("Quamber", Value(Dict{{"Attributes", Value(Dict{{"ovaro.protocol", Value(point)}})}}));
    } else {
        info.set("VTExtension", Value(Dict{{"VTExtensionAttributes", Value(Dict{{"VTExtensionPointName", Value(point)}})}}));
    }
    if (executable) {
        info.set("MRBundleExecutable", Value("run"));
    }
    return info;
}

// Writes Info.plist (desktop style: Contents/Info.plist); returns the bundle.
std::string writeBundle(const std::string& bundle, const Dict& info, bool desktop = false) {
    writePlist(bundle + (desktop ? "/Contents/Info.plist" : "/Info.plist"), Value(info));
    return bundle;
}

std::string resolved(const std::string& path) {
    auto r = qm::resolvedPath(path);
    return r ? *r : path;
}

// Records what it is told; checks that lookups, which never wait for the
// catalog's thread, already answer for what it is told was installed.
class Recorder : public qm::AppCatalogObserver {
public:
    const AppCatalog* catalog = nullptr;
    std::atomic<int> unseen{0};

    void pluginsDidInstall(const std::vector<PlugInRecordPtr>& records) override {
        for (const auto& record : records) {
            unseen += catalog->plugInWithUuid(record->uuid) == record ? 0 : 1;
        }
        add(installed_, records);
    }
    void pluginsWillUninstall(const std::vector<PlugInRecordPtr>& records) override { add(uninstalled_, records); }
    std::vector<PlugInRecordPtr> installed() const { return copy(installed_); }
    std::vector<PlugInRecordPtr> uninstalled() const { return copy(uninstalled_); }
    std::set<std::string> installedIdentifiers() const { return identifiers(installed()); }
    std::set<std::string> uninstalledIdentifiers() const { return identifiers(uninstalled()); }
    static std::set<std::string> identifiers(const std::vector<PlugInRecordPtr>& records) {
        std::set<std::string> ids;
        for (const auto& r : records) {
            ids.insert(r->identifier);
        }
        return ids;
    }

private:
    void add(std::vector<PlugInRecordPtr>& list, const std::vector<PlugInRecordPtr>& records) {
        std::lock_guard lock(mutex_);
        list.insert(list.end(), records.begin(), records.end());
    }
    std::vector<PlugInRecordPtr> copy(const std::vector<PlugInRecordPtr>& list) const {
        std::lock_guard lock(mutex_);
        return list;
    }
    mutable std::mutex mutex_;
    std::vector<PlugInRecordPtr> installed_;
    std::vector<PlugInRecordPtr> uninstalled_;
};

// A system root, a user root, a database and a containers folder in one
// temporary directory; catalogs opened on them with a fresh observer each.
class AppCatalogTest : public ::testing::Test {
protected:
    AppCatalogTest() : base(resolved(dir.path())) {}

    qm::AppCatalogOptions options() const {
        qm::AppCatalogOptions o;
        o.databasePath = databasePath;
        o.systemRoots = {systemRoot, base + "/missing-root"};
        o.userRoot = userRoot;
        o.containersDirectory = containers;
        o.language = "fr";
        o.lockTimeout = std::chrono::milliseconds(200);
        return o;
    }

    void open(const std::optional<qm::AppCatalogOptions>& given = std::nullopt) {
        catalog.reset();
        recorder = std::make_shared<Recorder>();
        auto opened = AppCatalog::open(given ? *given : options());
        ASSERT_TRUE(opened) << opened.error().text();
        catalog = std::move(opened).value();
        recorder->catalog = catalog.get();
        catalog->addObserver(recorder);
        catalog->start();
        catalog->waitUntilReady();
    }

    void TearDown() override {
        ASSERT_TRUE(recorder);
        EXPECT_EQ(recorder->unseen.load(), 0);
    }

    PlugInRecordPtr byIdentifier(const std::string& identifier) const {
        for (const auto& record : catalog->installedPlugIns()) {
            if (record->identifier == identifier) {
                return record;
            }
        }
        return nullptr;
    }

    qmtest::TempDir dir;
    std::string base;
    std::string systemRoot = base + "/system";
    std::string userRoot = base + "/user/Applications";
    std::string containers = base + "/data/Containers";
    std::string databasePath = base + "/data/AppCatalog.db";
    std::shared_ptr<Recorder> recorder;
    std::unique_ptr<AppCatalog> catalog;
};

TEST_F(AppCatalogTest, ScanFindsPlugInsOfBothLayoutsAndEveryMultipleEntry) {
    std::string flatApp = systemRoot + "/Flat.app";
    std::string deskApp = systemRoot + "/Desk.app";
    writeBundle(flatApp, {{"MRBundleName", Value("Flat")}, {"MRBundleDisplayName", Value("Flat Display")}});
    writePlist(flatApp + "/fr.lproj/InfoPlist.strings", Value(Dict{{"MRBundleDisplayName", Value("Plat")}}));
    writeBundle(flatApp + "/PlugIns/New.bundle", plugInInfo("com.new", "point.a"));
    writePlist(flatApp + "/PlugIns/New.bundle/Entitlements.plist", Value(Dict{{"ent.x", Value(true)}}));
    writePlist(flatApp + "/PlugIns/New.bundle/fr.lproj/InfoPlist.strings",
               Value(Dict{{"MRBundleName", Value("Nouveau")}}));
    writeBundle(flatApp + "/PlugIns/Data.bundle", plugInInfo("com.data", "point.a", false, false));
    writeBundle(flatApp + "/PlugIns/Plain.bundle", {{"MRBundleIdentifier", Value("com.plain")}});
    writeBundle(deskApp + "/Contents/PlugIns/Old.bundle", plugInInfo("com.old", "point.b", true), true);
    Dict multiple = plugInInfo("com.multi.bundle", "point.top");
    Dict entryOwn{{"VTExtensionAttributes", Value(Dict{{"VTExtensionPointName", Value("point.own")}})}};
    multiple.set("VTExtension",
                 Value(multiple.find("VTExtension")
                           ->asDictionary()
                           ->changing("Multiple", Value(Dict{{"com.multi.b", Value(entryOwn)},
                                                             {"com.multi.a", Value(Dict{{"Other", Value(1)}})}}))));
    writeBundle(deskApp + "/Contents/PlugIns/Multi.bundle", multiple, true);
    writeBundle(systemRoot + "/NotAnApp/PlugIns/Lost.bundle", plugInInfo("com.lost", "point.a"));
    writeBundle(userRoot + "/User.app/PlugIns/User.bundle", plugInInfo(".hidden", "point.a"));
    fs::create_directories(systemRoot + "/Empty.app");

    LogCapture log;
    open();
    EXPECT_TRUE(log.contains("missing-root")) << log.text();

    struct Expected {
        const char* identifier;
        const char* bundle;
        const char* point;
        const char* application;
        bool system;
        bool container;
    };
    const Expected table[] = {
        {"com.new", "/system/Flat.app/PlugIns/New.bundle", "point.a", "/system/Flat.app", true, true},
        {"com.data", "/system/Flat.app/PlugIns/Data.bundle", "point.a", "/system/Flat.app", true, false},
        {"com.old", "/system/Desk.app/Contents/PlugIns/Old.bundle", "point.b", "/system/Desk.app", true, true},
        {"com.multi.a", "/system/Desk.app/Contents/PlugIns/Multi.bundle", "point.top", "/system/Desk.app", true, true},
        {"com.multi.b", "/system/Desk.app/Contents/PlugIns/Multi.bundle", "point.own", "/system/Desk.app", true, true},
        {".hidden", "/user/Applications/User.app/PlugIns/User.bundle", "point.a", "/user/Applications/User.app", false,
         false},
    };
    ASSERT_EQ(catalog->installedPlugIns().size(), std::size(table));
    EXPECT_EQ(recorder->installed().size(), std::size(table));
    for (const auto& expected : table) {
        SCOPED_TRACE(expected.identifier);
        PlugInRecordPtr record = byIdentifier(expected.identifier);
        ASSERT_TRUE(record);
        EXPECT_EQ(record->bundlePath, base + expected.bundle);
        EXPECT_EQ(record->extensionPoint, expected.point);
        ASSERT_TRUE(record->containingApplication);
        EXPECT_EQ(record->containingApplication->path, base + expected.application);
        EXPECT_EQ(record->onSystemVolume, expected.system);
        EXPECT_EQ(record->dataContainerPath.has_value(), expected.container);
        if (record->dataContainerPath) {
            EXPECT_TRUE(fs::is_directory(*record->dataContainerPath + "/tmp"));
        }
        EXPECT_EQ(catalog->plugInWithUuid(record->uuid), record);
        const Value* url = record->infoDictionary.get("MRBundleInfoPlistURL");
        ASSERT_TRUE(url && url->isString());
        EXPECT_TRUE(url->asString()->starts_with("file://" + base));
    }
    EXPECT_TRUE(log.contains("\".hidden\" cannot name")) << log.text();

    PlugInRecordPtr fresh = byIdentifier("com.new");
    EXPECT_EQ(fresh->localizedShortName, "Nouveau");
    EXPECT_EQ(fresh->localizedName, "Nouveau");
    EXPECT_EQ(fresh->containingApplication->localizedName, "Plat");
    EXPECT_EQ(fresh->entitlements, Value(Dict{{"ent.x", Value(true)}}));
    EXPECT_EQ(fresh->dataContainerPath, containers + "/com.new");
    EXPECT_EQ(byIdentifier("com.multi.b")->plugInDictionary, Value(entryOwn));
    EXPECT_EQ(byIdentifier("com.old")->infoDictionary.get("Quamber")->isDictionary(), true);

    // A bundle with several plug-ins answers the first by identifier.
    EXPECT_EQ(catalog->plugInAtPath(deskApp + "/Contents/PlugIns/Multi.bundle/")->identifier, "com.multi.a");
    auto desk = catalog->applicationAtPath(deskApp);
    ASSERT_TRUE(desk);
    ASSERT_EQ(desk->plugIns.size(), 3u);
    EXPECT_EQ(desk->plugIns[0]->identifier, "com.multi.a");
    EXPECT_EQ(desk->plugIns[2]->identifier, "com.old");
    auto empty = catalog->applicationAtPath(systemRoot + "/Empty.app");
    ASSERT_TRUE(empty);
    EXPECT_TRUE(empty->plugIns.empty());
    EXPECT_FALSE(catalog->applicationAtPath(systemRoot + "/NotAnApp"));
}

TEST_F(AppCatalogTest, ExtensionPointQueryFiltersOnIdentifierAndEntitlements) {
    for (const char* name : {"b", "a", "c"}) {
        std::string bundle = writeBundle(userRoot + "/Q.app/PlugIns/" + name + ".bundle",
                                         plugInInfo(std::string("q.") + name, name == std::string("c") ? "other" : "p"));
        writePlist(bundle + "/Entitlements.plist", Value(Dict{{"grade", Value(std::string(name))}}));
    }
    open();
    struct Case {
        std::vector<std::string> points;
        qm::PlugInFilter filter;
        std::vector<std::string> expected;
    };
    auto notB = [](const std::string& id, const std::optional<Value>&) { return id != "q.b"; };
    auto gradeC = [](const std::string&, const std::optional<Value>& entitlements) {
        return entitlements && *entitlements->get("grade")->asString() == "c";
    };
    const Case cases[] = {
        {{"p"}, {}, {"q.a", "q.b"}},
        {{"p", "other", "p"}, {}, {"q.a", "q.b", "q.c"}},
        {{"p", "other"}, notB, {"q.a", "q.c"}},
        {{"p", "other"}, gradeC, {"q.c"}},
        {{"nowhere"}, {}, {}},
    };
    for (const auto& c : cases) {
        std::vector<std::string> got;
        for (const auto& record : catalog->plugInsForExtensionPoints(c.points, c.filter)) {
            got.push_back(record->identifier);
        }
        EXPECT_EQ(got, c.expected);
    }
}

TEST_F(AppCatalogTest, RestartKeepsIdentityAndReadsOnlyWhatChanged) {
    std::string plugIns = userRoot + "/R.app/PlugIns/";
    writeBundle(plugIns + "Same.bundle", plugInInfo("r.same", "p"));
    writeBundle(plugIns + "Changed.bundle", plugInInfo("r.changed", "p"));
    std::string entitled = writeBundle(plugIns + "Entitled.bundle", plugInInfo("r.entitled", "p"));
    writePlist(plugIns + "Same.bundle/de.lproj/InfoPlist.strings", Value(Dict{{"MRBundleName", Value("Gleich")}}));
    writeBundle(plugIns + "Gone.bundle", plugInInfo("r.gone", "p"));
    std::string outside = writeBundle(base + "/loose/Added.bundle", plugInInfo("r.added", "p"));
    open();
    ASSERT_FALSE(catalog->registerPlugIn(outside));
    auto before = catalog->installedPlugIns();
    ASSERT_EQ(before.size(), 5u);
    PlugInRecordPtr same = byIdentifier("r.same");
    EXPECT_EQ(same->localizedShortName, "r.same name");
    EXPECT_FALSE(byIdentifier("r.added")->onSystemVolume);

    open();  // nothing changed
    EXPECT_EQ(catalog->infoFilesParsed(), 0u);
    EXPECT_TRUE(recorder->installed().empty());
    EXPECT_TRUE(recorder->uninstalled().empty());
    auto after = catalog->installedPlugIns();
    ASSERT_EQ(after.size(), before.size());
    for (std::size_t i = 0; i < after.size(); ++i) {
        EXPECT_EQ(after[i]->uuid, before[i]->uuid);
        EXPECT_EQ(after[i]->registrationDate, before[i]->registrationDate);
        EXPECT_EQ(after[i]->registrationDate.secondsSince1970,
                  static_cast<double>(static_cast<std::int64_t>(after[i]->registrationDate.secondsSince1970)));
    }

    catalog.reset();
    writeBundle(plugIns + "Changed.bundle", plugInInfo("r.changed", "p2"));
    writePlist(entitled + "/Entitlements.plist", Value(Dict{{"e", Value(true)}}));
    fs::remove_all(plugIns + "Gone.bundle");
    auto moved = options();
    moved.systemRoots = {base + "/loose"};  // the added bundle now lies on the system volume
    open(moved);
    EXPECT_EQ(catalog->infoFilesParsed(), 2u);
    EXPECT_EQ(recorder->uninstalledIdentifiers(), (std::set<std::string>{"r.changed", "r.entitled", "r.gone"}));
    EXPECT_EQ(recorder->installedIdentifiers(), (std::set<std::string>{"r.changed", "r.entitled"}));
    for (const auto& old : before) {
        if (PlugInRecordPtr now = byIdentifier(old->identifier)) {
            bool renewed = old->identifier == "r.changed" || old->identifier == "r.entitled";
            EXPECT_EQ(now->uuid != old->uuid, renewed) << old->identifier;
        }
    }
    EXPECT_EQ(byIdentifier("r.changed")->extensionPoint, "p2");
    EXPECT_TRUE(byIdentifier("r.entitled")->entitlements);
    EXPECT_TRUE(byIdentifier("r.added")->onSystemVolume);

    // Another language renames without re-registering.
    auto german = moved;
    german.language = "de";
    open(german);
    EXPECT_EQ(byIdentifier("r.same")->localizedShortName, "Gleich");
    EXPECT_EQ(byIdentifier("r.same")->uuid, same->uuid);
    EXPECT_TRUE(recorder->installed().empty());
}

TEST_F(AppCatalogTest, WatchedFoldersShowInstallsUpdatesAndRemovals) {
    open();
    std::string app = userRoot + "/Live.app";
    // An application appears with a desktop-style bundle written piece by piece.
    fs::create_directories(app + "/Contents/PlugIns/Live.bundle/Contents");
    ASSERT_TRUE(eventually([&] { return catalog->applicationAtPath(app) != nullptr; }));
    writeBundle(app + "/Contents/PlugIns/Live.bundle", plugInInfo("live.one", "p"), true);
    ASSERT_TRUE(eventually([&] { return byIdentifier("live.one") != nullptr; }));
    EXPECT_EQ(recorder->installedIdentifiers(), std::set<std::string>{"live.one"});
    PlugInRecordPtr first = byIdentifier("live.one");

    // An update replaces the bundle: a new registration.
    std::string staged = writeBundle(base + "/staging/Live.bundle", plugInInfo("live.one", "p2"), true);
    fs::rename(app + "/Contents/PlugIns/Live.bundle", base + "/staging/Old.bundle");
    fs::rename(staged, app + "/Contents/PlugIns/Live.bundle");
    ASSERT_TRUE(eventually([&] {
        auto now = byIdentifier("live.one");
        return now && now->uuid != first->uuid;
    }));
    EXPECT_EQ(byIdentifier("live.one")->extensionPoint, "p2");
    EXPECT_EQ(recorder->uninstalled().at(0)->uuid, first->uuid);

    // A plug-ins folder made after the application, in the flat layout.
    writeBundle(app + "/PlugIns/Flat.bundle", plugInInfo("live.flat", "p"));
    ASSERT_TRUE(eventually([&] { return byIdentifier("live.flat") != nullptr; }));

    fs::remove_all(app);
    ASSERT_TRUE(eventually([&] { return catalog->installedPlugIns().empty(); }));
    EXPECT_EQ(recorder->uninstalledIdentifiers(), (std::set<std::string>{"live.one", "live.flat"}));
    EXPECT_FALSE(catalog->applicationAtPath(app));
}

TEST_F(AppCatalogTest, RegisterAndUnregisterByPath) {
    std::string installed = writeBundle(userRoot + "/In.app/PlugIns/In.bundle", plugInInfo("reg.in", "p"));
    std::string looseApp = base + "/elsewhere/Loose.app";
    writeBundle(looseApp, {{"MRBundleName", Value("Loose")}});
    std::string inLooseApp = writeBundle(looseApp + "/Contents/PlugIns/X.bundle", plugInInfo("reg.x", "p"));
    std::string alone = writeBundle(base + "/elsewhere/Alone.bundle", plugInInfo("reg.alone", "p"));
    fs::create_directory_symlink(alone, base + "/link");
    writeBundle(base + "/elsewhere/Plain.bundle", {{"MRBundleIdentifier", Value("plain")}});
    fs::create_directories(base + "/elsewhere/Empty");
    open();

    using E = qm::AppCatalogError;
    struct Refusal {
        std::string path;
        E expected;
    };
    const Refusal refusals[] = {
        {base + "/nothing-here", E::notAPlugIn},
        {base + "/elsewhere/Empty", E::notAPlugIn},
        {base + "/elsewhere/Plain.bundle", E::notAPlugIn},
        {looseApp, E::applicationBundle},
        {userRoot + "/In.app", E::applicationBundle},
    };
    for (const auto& refusal : refusals) {
        auto error = catalog->registerPlugIn(refusal.path);
        ASSERT_TRUE(error) << refusal.path;
        EXPECT_EQ(qm::appCatalogErrorOf(*error), refusal.expected) << refusal.path << ": " << error->text();
    }
    EXPECT_EQ(qm::appCatalogErrorOf(*catalog->unregisterPlugIn(alone)), E::notRegistered);

    ASSERT_FALSE(catalog->registerPlugIn(base + "/link"));  // stored resolved
    PlugInRecordPtr record = catalog->plugInAtPath(alone);
    ASSERT_TRUE(record);
    EXPECT_EQ(record->bundlePath, alone);
    EXPECT_FALSE(record->containingApplication);
    EXPECT_EQ(recorder->installedIdentifiers(), (std::set<std::string>{"reg.in", "reg.alone"}));
    ASSERT_FALSE(catalog->registerPlugIn(alone));
    EXPECT_EQ(catalog->plugInAtPath(alone)->uuid, record->uuid);
    ASSERT_FALSE(catalog->registerPlugIn(inLooseApp));
    EXPECT_EQ(byIdentifier("reg.x")->containingApplication->localizedName, "Loose");
    EXPECT_EQ(catalog->applicationAtPath(looseApp)->plugIns.size(), 1u);

    // Registrations outlive a restart; one whose bundle is gone is dropped.
    open();
    EXPECT_EQ(catalog->plugInAtPath(alone)->uuid, record->uuid);
    catalog.reset();
    fs::remove_all(inLooseApp);
    open();
    EXPECT_EQ(recorder->uninstalledIdentifiers(), std::set<std::string>{"reg.x"});
    EXPECT_FALSE(catalog->applicationAtPath(looseApp));

    // A registered bundle deleted while the catalog runs is dropped.
    fs::remove_all(alone);
    ASSERT_TRUE(eventually([&] { return !catalog->plugInAtPath(alone); }));

    // An installed plug-in unregistered comes back at the next event in its folder.
    PlugInRecordPtr scanned = catalog->plugInAtPath(installed);
    ASSERT_FALSE(catalog->unregisterPlugIn(installed));
    EXPECT_FALSE(catalog->plugInAtPath(installed));
    EXPECT_EQ(recorder->uninstalled().back()->uuid, scanned->uuid);
    fs::create_directories(userRoot + "/In.app/PlugIns/Unrelated");
    ASSERT_TRUE(eventually([&] { return catalog->plugInAtPath(installed) != nullptr; }));
    EXPECT_NE(catalog->plugInAtPath(installed)->uuid, scanned->uuid);
}

TEST_F(AppCatalogTest, DamagedDatabaseIsMovedAsideAndRebuilt) {
    writeBundle(userRoot + "/D.app/PlugIns/D.bundle", plugInInfo("damage.d", "p"));
    auto foreign = [this](int applicationId, int version) {
        sqlite3* db = nullptr;
        ASSERT_EQ(sqlite3_open(databasePath.c_str(), &db), SQLITE_OK);
        std::string sql = "CREATE TABLE t (x); PRAGMA application_id=" + std::to_string(applicationId) +
                          "; PRAGMA user_version=" + std::to_string(version) + ";";
        EXPECT_EQ(sqlite3_exec(db, sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK);
        sqlite3_close(db);
    };
    const std::pair<const char*, std::function<void()>> cases[] = {
        {"garbage", [this] { qmtest::writeFile(databasePath, std::string(8192, 'x')); }},
        {"another application_id", [&] { foreign(42, 1); }},
        {"another user_version", [&] { foreign(0x514D4341, 9); }},
    };
    for (const auto& [name, damage] : cases) {
        SCOPED_TRACE(name);
        fs::remove_all(base + "/data");
        fs::create_directories(base + "/data");
        damage();
        LogCapture log;
        open();
        EXPECT_TRUE(log.contains("is damaged")) << log.text();
        EXPECT_EQ(recorder->installedIdentifiers(), std::set<std::string>{"damage.d"});
        std::size_t aside = 0;
        for (const auto& entry : fs::directory_iterator(base + "/data")) {
            aside += entry.path().filename().string().starts_with("AppCatalog.db.bad-") ? 1 : 0;
        }
        EXPECT_GE(aside, 1u);
        PlugInRecordPtr record = byIdentifier("damage.d");
        open();  // the rebuilt file is sound and keeps the identity
        EXPECT_EQ(byIdentifier("damage.d")->uuid, record->uuid);
        EXPECT_TRUE(recorder->installed().empty());
        catalog.reset();
    }
}

TEST_F(AppCatalogTest, SecondOpenerWaitsThenFails) {
    open();
    LogCapture log;
    auto second = AppCatalog::open(options());
    ASSERT_FALSE(second);
    EXPECT_EQ(second.error().code, EBUSY);
    EXPECT_TRUE(log.contains("locked by another process")) << log.text();
}

TEST(PlugInDeclarations, BothVocabulariesAndTheirFallbacks) {
    Dict newAttributes{{"VTExtensionIdentifier", Value("n.id")}, {"VTExtensionPointName", Value("n.point")}};
    Dict oldAttributes{{"ovaro.identifier", Value("o.id")}, {"ovaro.protocol", Value("o.point")}};
    Dict ownPoint{{"VTExtensionAttributes", Value(Dict{{"VTExtensionPointName", Value("own")}})}};
    Dict oldOwnPoint{{"Attributes", Value(Dict{{"ovaro.protocol", Value("own")}})}};
    auto info = [](const char* top, Dict topDictionary) {
        return Value(Dict{{"MRBundleIdentifier", Value("bundle.id")}, {top, Value(std::move(topDictionary))}});
    };
    struct Case {
        const char* name;
        Value info;
        std::vector<std::pair<std::string, std::optional<std::string>>> expected;  // identifier, point
    };
    const Case cases[] = {
        {"new style", info("VTExtension", {{"VTExtensionAttributes", Value(newAttributes)}}), {{"n.id", "n.point"}}},
        {"old style", info("Quamber", {{"Attributes", Value(oldAttributes)}}), {{"o.id", "o.point"}}},
        {"old keys in a new top are not read", info("VTExtension", {{"Attributes", Value(oldAttributes)}}),
         {{"bundle.id", std::nullopt}}},
        {"both: the new one wins",
         Value(info("Quamber", {{"Attributes", Value(oldAttributes)}})
                   .asDictionary()
                   ->changing("VTExtension", Value(Dict{{"VTExtensionAttributes", Value(newAttributes)}}))),
         {{"n.id", "n.point"}}},
        {"multiple, new style",
         info("VTExtension", {{"VTExtensionAttributes", Value(newAttributes)},
                              {"Multiple", Value(Dict{{"m.2", Value(ownPoint)}, {"m.1", Value(Dict{})}})}}),
         {{"m.1", "n.point"}, {"m.2", "own"}}},
        {"multiple, old style",
         info("Quamber", {{"Attributes", Value(oldAttributes)}, {"Multiple", Value(Dict{{"m.1", Value(oldOwnPoint)}})}}),
         {{"m.1", "own"}}},
        {"multiple that is no dictionary", info("VTExtension", {{"Multiple", Value("x")}}), {{"bundle.id", std::nullopt}}},
        {"top that is no dictionary", Value(Dict{{"MRBundleIdentifier", Value("b")}, {"VTExtension", Value(3)}}),
         {{"b", std::nullopt}}},
        {"nothing identifies it", Value(Dict{{"VTExtension", Value(Dict{})}}), {}},
        {"no plug-in at all", Value(Dict{{"MRBundleIdentifier", Value("b")}}), {}},
    };
    for (const auto& c : cases) {
        std::vector<std::pair<std::string, std::optional<std::string>>> got;
        for (const auto& declared : qm::declaredPlugIns(c.info)) {
            got.emplace_back(declared.identifier, declared.extensionPoint);
        }
        EXPECT_EQ(got, c.expected) << c.name;
    }
}

TEST(DataContainer, NamedByTheBundleIdentifierForCodePlugInsOnly) {
    qmtest::TempDir dir;
    const std::string containers = dir.file("Containers");
    struct Case {
        std::optional<std::string> identifier;
        bool executable;
        bool made;
    };
    const Case cases[] = {
        {"com.ok", true, true},   {"com.ok", false, false}, {"", true, false},
        {"a/b", true, false},     {".hidden", true, false}, {"..", true, false},
        {std::nullopt, true, false},
    };
    for (const auto& c : cases) {
        Dict info;
        if (c.identifier) {
            info.set("MRBundleIdentifier", Value(*c.identifier));
        }
        if (c.executable) {
            info.set("MRBundleExecutable", Value("run"));
        }
        LogCapture log;
        auto container = qm::makeDataContainer(containers, Value(info), "/b");
        EXPECT_EQ(container.has_value(), c.made) << c.identifier.value_or("(none)");
        EXPECT_EQ(log.lines().size(), c.made || !c.executable ? 0u : 1u) << log.text();
        if (container) {
            EXPECT_TRUE(fs::is_directory(*container + "/tmp"));
        }
    }
}

TEST_F(AppCatalogTest, BundlesThatCannotBeStoredAreRefusedAlone) {
    // A date past what a property list can write: readable, not storable.
    std::string odd = base + "/elsewhere/Odd.bundle";
    qmtest::writeFile(odd + "/Info.plist",
                      "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict>"
                      "<key>MRBundleIdentifier</key><string>odd</string><key>VTExtension</key><dict/>"
                      "<key>When</key><date>2150-01-01T00:00:00Z</date></dict></plist>");
    fs::create_directories(userRoot + "/S.app/PlugIns");
    fs::copy(odd, userRoot + "/S.app/PlugIns/Odd.bundle", fs::copy_options::recursive);
    writeBundle(userRoot + "/S.app/PlugIns/Fine.bundle", plugInInfo("fine", "p"));
    open();
    EXPECT_EQ(recorder->installedIdentifiers(), std::set<std::string>{"fine"});
    auto error = catalog->registerPlugIn(odd);
    ASSERT_TRUE(error);
    EXPECT_EQ(qm::appCatalogErrorOf(*error), qm::AppCatalogError::notAPlugIn);
    EXPECT_NE(error->text().find("cannot be stored"), std::string::npos) << error->text();
}

TEST_F(AppCatalogTest, UntrustedEntitlementsAreLoggedOncePerRegistration) {
    std::string bundle = writeBundle(userRoot + "/T.app/PlugIns/T.bundle", plugInInfo("t", "p"));
    writePlist(bundle + "/Entitlements.plist", Value(Dict{{"e", Value(true)}}));
    ASSERT_EQ(::chmod((bundle + "/Entitlements.plist").c_str(), 0666), 0);
    LogCapture log;
    open();
    EXPECT_FALSE(byIdentifier("t")->entitlements);
    EXPECT_EQ(log.countContaining("entitlements not honoured"), 1u) << log.text();
    open();
    ASSERT_FALSE(catalog->registerPlugIn(bundle));
    EXPECT_EQ(log.countContaining("entitlements not honoured"), 1u) << log.text();
}

}  // namespace
