// The person's language: texts by the catalogs, dates in local time, numbers with separators; documents for programs
// stay.

#include "CommandWorld.h"
#include "TerminalSession.h"

#include "foundation/Date.h"

#include <filesystem>
#include <gmock/gmock.h>
#include <regex>

namespace rolvane::test {
namespace {

using testing::HasSubstr;

struct Language : testing::Test {
    // With a locale that the system's own definitions make, wherever it has generated it or not.
    void speak(const std::string& locale) {
        if (locale != "C") {
            const std::string place = world.home / "locales";
            std::filesystem::create_directories(place);
            const Ran made = world.run({"localedef", "--no-archive", "-i", locale.substr(0, locale.find('.')), "-f",
                                        "UTF-8", place + "/" + locale});
            ASSERT_EQ(made.status, 0) << made;
            world.home.setVariable("LOCPATH", place);
        }
        for (const char* other : {"LC_ALL", "LC_MESSAGES", "LC_TIME", "LC_NUMERIC", "LANGUAGE"})
            world.home.setVariable(other, std::nullopt);
        world.home.setVariable("LANG", locale);
    }
    CommandWorld world;
};

TEST_F(Language, OfTextsIsGermanOrFrenchWhereThePersonSpeaksIt) {
    world.add("Ada");
    speak("C");
    EXPECT_THAT(world.done({"status"}), HasSubstr("Contacts       1 person, 0 groups\n"));
    speak("de_DE.UTF-8");
    EXPECT_THAT(world.done({"status"}), testing::AllOf(HasSubstr("Kontakte       1 Person, 0 Gruppen\n"),
                                                       HasSubstr("Veröffentlicht nichts\n")));
    EXPECT_THAT(world.done({"--help"}), HasSubstr("Personen nach Wörtern aus Name"));
    EXPECT_TRUE(saysOnce(world.rolvane({"publish"}), kNoSuchThing, "Es gibt noch kein Konto auf einem Speicher."));
    speak("fr_FR.UTF-8");
    EXPECT_THAT(world.done({"status"}), HasSubstr("1 personne, 0 groupe\n")) << "none is one, in French";
    EXPECT_TRUE(saysOnce(world.rolvane({"show", "Nobody"}), kNoSuchThing, "Il n'y a pas de personne « Nobody »."));
}

TEST_F(Language, OfWhatIsWrongWithALineIsGermanOrFrench) {
    const std::vector<std::string> number{"sync", "--timeout", "x"}, choice{"store", "start", "--authentication", "x"},
        both{"store", "start", "--system", "--directory", "/nowhere"};
    speak("C");
    EXPECT_TRUE(saysOnce(world.rolvane({"show"}), kWrongLine, "rolvane: names is missing. `rolvane show --help`"));
    EXPECT_TRUE(saysOnce(world.rolvane({"list", "--foo"}), kWrongLine, "rolvane: Nothing is known of: --foo."));
    EXPECT_TRUE(saysOnce(world.rolvane({"store"}), kWrongLine, "A command is missing behind this one."));
    EXPECT_TRUE(saysOnce(world.rolvane({"publish", "--group"}), kWrongLine, "--group lacks its value."));
    EXPECT_TRUE(saysOnce(world.rolvane(number), kWrongLine, "--timeout takes a number greater than 0, not \"x\"."));
    EXPECT_TRUE(
        saysOnce(world.rolvane(choice), kWrongLine, "--authentication takes one of basic,digest,none, not \"x\"."));
    EXPECT_TRUE(saysOnce(world.rolvane(both), kWrongLine, "--directory and --system exclude each other."));
    EXPECT_TRUE(saysOnce(world.rolvane({"computers", "--qr"}), kWrongLine, "--qr is of use with --invite alone."));
    speak("de_DE.UTF-8");
    EXPECT_TRUE(saysOnce(world.rolvane({"show"}), kWrongLine, "rolvane: names fehlt."));
    EXPECT_TRUE(saysOnce(world.rolvane({"list", "--foo"}), kWrongLine, "Unbekannt ist: --foo."));
    EXPECT_TRUE(saysOnce(world.rolvane(number), kWrongLine, "--timeout nimmt eine Zahl größer als 0, nicht „x“."));
    speak("fr_FR.UTF-8");
    EXPECT_TRUE(saysOnce(world.rolvane(both), kWrongLine, "--directory et --system s'excluent."));
    EXPECT_TRUE(saysOnce(world.rolvane({"publish", "--group"}), kWrongLine, "--group n'a pas de valeur."));
}

TEST_F(Language, OfTextsIsSpokenOnASystemThatHasNotMadeItsOwnFilesForIt) {
    world.home.setVariable("LOCPATH", world.home / "none");
    world.home.setVariable("LANG", "de_DE.UTF-8");
    EXPECT_TRUE(saysOnce(world.rolvane({"publish"}), kNoSuchThing, "Es gibt noch kein Konto auf einem Speicher."));
    world.home.setVariable("LANG", "xx_XX.UTF-8");
    EXPECT_TRUE(saysOnce(world.rolvane({"publish"}), kNoSuchThing, "There is no account on a store yet."));
}

TEST_F(Language, OfDocumentsForProgramsIsTheSameEverywhere) {
    world.add("Ada", {"--birthday", "1815-12-10"});
    const std::vector<std::vector<std::string>> commands{{"status", "--json"},
                                                         {"list", "--json", "--full"},
                                                         {"--json", "log"},
                                                         {"manual", "commands"},
                                                         {"account", "show", "--json"}};
    speak("C");
    std::vector<Ran> plain;
    for (const auto& command : commands) plain.push_back(world.rolvane(command));
    speak("de_DE.UTF-8");
    for (size_t i = 0; i < commands.size(); ++i) {
        const Ran german = world.rolvane(commands[i]);
        EXPECT_EQ(german.output, plain[i].output);
        EXPECT_EQ(german.errors, plain[i].errors);
    }
}

TEST_F(Language, OfDatesIsLocalTimeAsThePersonWritesIt) {
    world.add("Ada");
    world.home.setVariable("TZ", "Asia/Tokyo"); // nine hours ahead all year
    const std::string date = world.json({"log"})[0]["date"];
    const std::string there = Date::fromISO8601(date)->addingSeconds(9 * 3600).toISO8601(); // "2026-11-23T18:00:00Z"
    const std::string day = there.substr(0, 10), time = there.substr(11, 8);
    speak("C");
    EXPECT_THAT(world.done({"log"}), HasSubstr(day + " " + time));
    speak("de_DE.UTF-8");
    EXPECT_THAT(world.done({"log"}),
                HasSubstr(day.substr(8, 2) + "." + day.substr(5, 2) + "." + day.substr(0, 4) + " " + time));
}

TEST_F(Language, OfDaysIsAsThePersonWritesThemInContactsAndTheLog) {
    world.add("Ada");
    world.done({"edit", "Ada", "--birthday", "1980-12-31"});
    speak("C");
    EXPECT_THAT(world.done({"show", "Ada"}), HasSubstr("Birthday          1980-12-31\n"));
    world.home.setVariable("TZ", "America/Los_Angeles"); // no zone moves a birthday
    speak("de_DE.UTF-8");
    EXPECT_THAT(world.done({"show", "Ada"}), HasSubstr("Geburtstag        31.12.1980\n"));
    EXPECT_THAT(world.done({"log", "Ada"}), HasSubstr("Geburtstag: nichts -> 31.12.1980\n"));
    EXPECT_EQ(world.json({"show", "Ada"})["properties"]["Birthday"], "1980-12-31T00:00:00Z");
    speak("fr_FR.UTF-8");
    EXPECT_THAT(world.done({"show", "Ada"}), HasSubstr("Anniversaire      31/12/1980\n"));
}

// A question shows the letters of the person's language, and takes those of English as well.
TEST_F(Language, OfAnswersIsThePersons) {
    speak("de_DE.UTF-8");
    const auto answered = [&](const std::string& answer) {
        world.add("Eve");
        TerminalSession session(quotedForShell(UserWorld::rolvaneProgram()) + " delete Eve", world.home.environment());
        EXPECT_TRUE(session.answer("[j/N] ", answer)) << session.shown();
        return session.end();
    };
    EXPECT_EQ(answered("j"), kDone);
    EXPECT_EQ(answered("Ja"), kDone);
    EXPECT_EQ(answered("y"), kDone);
    EXPECT_EQ(answered("nein"), kNotAllowed);
}

TEST_F(Language, OfNumbersSeparatesThousands) {
    std::string cards;
    for (int i = 0; i < 1234; ++i)
        cards += "BEGIN:VCARD\r\nVERSION:3.0\r\nFN:P" + std::to_string(i) + "\r\nN:;P" + std::to_string(i) +
                 ";;;\r\nEND:VCARD\r\n";
    world.done({"import", "-q", world.write("cards.vcf", cards)});
    speak("C");
    EXPECT_THAT(world.done({"status"}), HasSubstr(" 1234 people"));
    speak("de_DE.UTF-8");
    EXPECT_THAT(world.done({"status"}), HasSubstr(" 1.234 Personen"));
    EXPECT_EQ(world.json({"status"})["people"], 1234);
}

} // namespace
} // namespace rolvane::test
