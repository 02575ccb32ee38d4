// The questions that zq3hist answers about images.
#include <nlohmann/json.hpp>
#include <random>

#include "tests/admin/program.h"
#include "tests/admin/schema.h"

using nlohmann::json;

class QuestionTest : public ProgramTest
{
  protected:
    json ask(const std::string& arguments, int status = 0)
    {
        std::string text = run(arguments);
        EXPECT_TRUE(status < 0 || text.ends_with("[" + std::to_string(status) + "]"))
            << arguments << text;
        json answer = json::parse(slurp(root + "out"));
        EXPECT_EQ(1, answer["format"]);
        return answer;
    }
};

static std::string stanza(const std::string& operation, long long timestamp,
                          const std::string& rest, const std::vector<std::string>& names = {})
{
    std::string text =
        "Operation: " + operation + "\nTimestamp: " + std::to_string(timestamp) + "\n" + rest;
    for (const std::string& name : names)
        text += "Tablespace: " + name + "\n";
    return text + "\n";
}

// A history of anything that can happen to four tablespaces.
static std::string anyHistory(std::mt19937& random, std::string* onHand)
{
    static const char* const types[] = {"full", "incremental", "delta", "delta"};
    static const std::vector<std::string> names = {"A", "B", "C", "D"};
    std::string text;
    for (long long time = 20250101000000; time < 20250101000040; time++) {
        std::vector<std::string> some;
        for (const std::string& name : names)
            if (random() % 3 != 0)
                some.push_back(name);
        long long earlier = 20250101000000 + static_cast<long long>(random() % 40);
        switch (random() % 12) {
        case 0:
            text += stanza("restore", time, "Id: " + std::to_string(earlier) + "\n", some);
            break;
        case 1:
            text += stanza("create tablespace", time, "", {names[random() % 4]});
            break;
        case 2:
            text +=
                stanza("rename tablespace", time, "", {names[random() % 4], names[random() % 4]});
            break;
        default:
            text += stanza("backup", time,
                           std::string("Type: ") + types[random() % 4] +
                               "\nObject: " + (random() % 2 == 0 ? "tablespace\n" : "database\n"),
                           some);
        }
        *onHand += random() % 20 != 0 ? std::to_string(time) + "\n" : "";
    }
    return text;
}

// The images of a list that are needed; not those without tablespaces, which are in every plan.
static std::set<std::string> timestampsOf(const json& images)
{
    std::set<std::string> timestamps;
    for (const json& image : images)
        if (image.value("known", true) && image.value("needed", true) &&
            image["tablespaceCount"] != 0)
            timestamps.insert(image["timestamp"].get<std::string>());
    return timestamps;
}

// What is said of all images comes of one walk, a plan of the planner's stages: they must agree.
TEST_F(QuestionTest, AllAnswersSayWhatThePlansSay)
{
    std::mt19937 random(11);
    int complete = 0, incomplete = 0;
    for (int round = 0; round < 14; round++) {
        std::string onHand;
        run("load h/", anyHistory(random, &onHand), "rm -f h/*; ");
        spill(root + "have", onHand);
        std::string have = round % 2 == 0 ? "" : " --have have";
        json list = ask("images --json h/" + have);
        std::set<std::string> all = timestampsOf(list["images"]), unneeded = all, needers;
        ASSERT_FALSE(all.empty());
        std::string one = *std::next(
            all.rbegin(), static_cast<int>(random() % (round % 3 == 0 ? 2 : all.size())));
        for (json& image : list["images"]) {
            std::string target = image["timestamp"];
            json plan = ask("plan --json h/ " + target + have, image["complete"] ? 0 : 6);
            for (const char* same : {"complete", "neededCount", "missing"})
                EXPECT_EQ(plan[same], image[same]) << target;
            (image["complete"] ? complete : incomplete)++;
            std::set<std::string> needed = timestampsOf(plan["images"]);
            if (have.empty() && target >= one) {
                EXPECT_EQ(timestampsOf(plan["images"]),
                          timestampsOf(ask("chart --json h/ " + target)["images"]))
                    << target;
            }
            if (target >= one)
                for (const std::string& timestamp : needed)
                    unneeded.erase(timestamp);
            if (image["complete"] && target != one && needed.contains(one))
                needers.insert(target);
        }
        if (have.empty()) {
            for (const std::string& timestamp : timestampsOf(ask("chart --json h/")["images"]))
                unneeded.erase(timestamp); // the next image may be taken on top of it
            EXPECT_EQ(unneeded, timestampsOf(ask("unneeded --json h/ --since " + one)["images"]));
            EXPECT_EQ(needers, timestampsOf(ask("needed-by --json h/ " + one)["images"]));
        }
    }
    EXPECT_GT(complete, 100);
    EXPECT_GT(incomplete, 100);
}

// What a plan is made of; images without tablespaces stand in every plan and belong to no chain.
static json chainsOf(const json& plan)
{
    json images = json::array();
    for (json image : plan["images"])
        if (image["tablespaceCount"] != 0) {
            image.erase("position");
            images.push_back(image);
        }
    json lacking = json::array();
    for (const json& missing : plan["missing"])
        lacking.push_back(missing["tablespace"]);
    return {plan["complete"], lacking, images};
}

TEST_F(QuestionTest, NoImageThatStaysMissesWhatIsPruned)
{
    std::mt19937 random(12);
    int pruned = 0, compared = 0;
    for (int round = 0; round < 10; round++) {
        std::string onHand;
        run("load h/", anyHistory(random, &onHand), "rm -f h/*; ");
        std::map<std::string, json> plans;
        json list = ask("images --json h/");
        for (const json& image : list["images"])
            plans[image["timestamp"]] =
                chainsOf(ask("plan --json h/ " + std::string(image["timestamp"]), -1));
        run("prune h/ --before 202501010000" + std::to_string(10 + random() % 25));
        pruned += slurp(root + "out").starts_with("0 of") ? 0 : 1;
        list = ask("images --json h/");
        for (const json& image : list["images"]) {
            std::string target = image["timestamp"];
            EXPECT_EQ(plans[target], chainsOf(ask("plan --json h/ " + target, -1))) << target;
            compared++;
        }
    }
    EXPECT_GT(pruned, 3);
    EXPECT_GT(compared, 100);
}

// Two tablespaces over ten days: a chain of every kind, an image of one tablespace alone, a failed
// one, one that was pruned, a restore of a lost image, and a full image of A only.
static std::string tenDays()
{
    const auto image = [](int day, const std::string& rest, const std::vector<std::string>& names) {
        return stanza("backup", 20250100010000 + day * 1000000, rest, names);
    };
    return image(1, "Type: full\n", {"A", "B"}) + image(2, "Type: delta\n", {"A", "B"}) +
           image(3, "Type: incremental\nNumber: 3\n", {"A", "B"}) +
           image(4, "Object: tablespace\nStatus: inactive\n", {"B"}) +
           image(5, "Type: delta\nNumber: 7\n", {"A", "B"}) +
           image(6, "Type: delta\nSQLCODE: -5\nNumber: 8\n", {"A", "B"}) +
           stanza("restore", 20250107010000, "Id: 20241201010000\nNumber: 9\n", {"B"}) +
           image(8, "Type: delta\nNumber: 10\n", {"A", "B"}) +
           image(9, "Type: full\nNumber: 11\n", {"A"});
}

TEST_F(QuestionTest, AnswersInFull)
{
    const struct {
        const char* arguments;
        const char* output;
    } rows[] = {
        {"images --all h/",
         "TIMESTAMP       KIND         SCOPE       TABLESPACES  IMAGES  RESTORE\n"
         "20250101010000  full         database              2       1  complete\n"
         "20250102010000  delta        database              2       2  complete\n"
         "20250103010000  incremental  database              2       2  complete\n"
         "20250104010000  full         tablespace            1       1  complete, inactive\n"
         "20250105010000  delta        database              2       4  chain found; the history "
         "lacks entries 5 to 6\n"
         "20250106010000  delta        database              2       -  failed: SQLCODE -5\n"
         "20250108010000  delta        database              2       4  incomplete: B lacks the "
         "image 20241201010000\n"
         "20250109010000  full         database              1       1  complete\n"
         "7 images, 8 shown, 1 incomplete; newest that can be restored: 20250109010000\n"
         "[0]"},
        {"images --since '2025-01-05T01:00:00' --incomplete h/",
         "TIMESTAMP       KIND         SCOPE       TABLESPACES  IMAGES  RESTORE\n"
         "20250108010000  delta        database              2       4  incomplete: B lacks the "
         "image 20241201010000\n"
         "7 images, 1 shown, 1 incomplete; newest that can be restored: 20250109010000\n"
         "[0]"},
        {"images e/", "TIMESTAMP       KIND         SCOPE       TABLESPACES  IMAGES  RESTORE\n"
                      "0 images, 0 incomplete\n"
                      "[0]"},
        {"images --have have --last 3 h/",
         "TIMESTAMP       KIND         SCOPE       TABLESPACES  IMAGES  RESTORE\n"
         "20250105010000  delta        database              2       4  incomplete: all 2 lack the "
         "image 20250105010000\n"
         "20250108010000  delta        database              2       4  incomplete: all 2 lack the "
         "image 20250108010000\n"
         "20250109010000  full         database              1       1  complete\n"
         "7 images, 3 shown, 4 incomplete; newest that can be restored: 20250109010000\n"
         "[0]"},
        {"plan h/ '2025-01-05 01:00:00'",
         "1/4  full         20250101010000  A  for 20250103010000\n"
         "2/4  incremental  20250103010000  A  for 20250105010000\n"
         "3/4  full         20250104010000  B  for 20250105010000\n"
         "4/4  delta        20250105010000  all 2  target\n"
         "zq3hist: warning: a chain was found, but the history lacks entries 5 to 6, and an image "
         "may have been among them\n"
         "[0]"},
        {"plan h/ latest b",
         "zq3hist: tablespace B lacks the image 20241201010000 that was restored, 20250108010000\n"
         "zq3hist: hint: zq3hist plan h/ 20250105010000  # the newest image that can be restored\n"
         "[6]"},
        {"plan --before 20250107000000 -- h/ A",
         "1/3  full         20250101010000  A  for 20250103010000\n"
         "2/3  incremental  20250103010000  A  for 20250105010000\n"
         "3/3  delta        20250105010000  A  target\n"
         "zq3hist: warning: a chain was found, but the history lacks entries 5 to 6, and an image "
         "may have been among them\n"
         "[0]"},
        {"plan --before 20250104020000 h/",
         "1/1  full         20250104010000  B  target\n"
         "zq3hist: note: 20250104010000 is an image of single tablespaces; the newest one of the "
         "whole database before it is 20250103010000\n"
         "[0]"},
        {"plan h/ --before 20241231000000", "zq3hist: no image is there up to 20241231000000, h/\n"
                                            "zq3hist: hint: zq3hist images h/  # lists all\n"
                                            "[5]"},
        {"plan --have have h/ 20250105010000",
         "zq3hist: all 2 tablespaces lack the image 20250105010000, which is not on hand, "
         "20250105010000\n"
         "zq3hist: hint: zq3hist plan h/ 20250109010000  # the newest image that can be restored\n"
         "[6]"},
        {"plan h/ 20250109010000 A C",
         "zq3hist: the image does not hold the tablespace C, 20250109010000\n"
         "[5]"},
        {"plan h/ 2025-13", "zq3hist: plan takes a timestamp such as 20250111010000 or '2025-01-11 "
                            "01:00:00', not 2025-13\n"
                            "Try 'zq3hist --help'.\n"
                            "[2]"},
        {"chart h/", "What the newest state needs\n"
                     "\n"
                     "   2025-01-01  01-05 01-09\n"
                     "   |           |     |\n"
                     "A  f  d  i  .  d  d  F\n"
                     "B  x  x  x  x  x  d  .\n"
                     "\n"
                     "F I D  needed: full, incremental, delta\n"
                     "f i d  not needed\n"
                     "x      discarded by a restore\n"
                     ".      not in the image\n"
                     "[0]"},
        {"chart h/ 20250105010000", "What 2025-01-05 01:00:00 needs\n"
                                    "\n"
                                    "   2025-01-01  01-05\n"
                                    "   |           |\n"
                                    "A  F  d  I  .  D\n"
                                    "B  f  d  i  F  D\n"
                                    "\n"
                                    "F I D  needed: full, incremental, delta\n"
                                    "f i d  not needed\n"
                                    ".      not in the image\n"
                                    "[0]"},
        {"unneeded --since 20250108000000 h/",
         "20250102010000  delta        database\n"
         "20250104010000  full         tablespace\n"
         "2 of 7 images are not needed by restores from 20250108000000\n"
         "[0]"},
        {"unneeded --keep 2 h/", "20250102010000  delta        database\n"
                                 "1 of 7 images are not needed by restores from 20250105010000\n"
                                 "[0]"},
        {"unneeded --since 20260101000000 h/",
         "zq3hist: no image is there from then on: 20260101000000, h/\n"
         "[5]"},
        {"needed-by h/ 20250103010000", "20250105010000  delta        database\n"
                                        "1 of 7 images need 20250103010000\n"
                                        "[0]"},
        {"needed-by h/ 20250107010000", "zq3hist: no image has the timestamp 20250107010000, h/\n"
                                        "zq3hist: hint: zq3hist images h/  # lists all\n"
                                        "[5]"},
        {"images --last x h/", "zq3hist: --last takes a number, not x\n"
                               "Try 'zq3hist --help'.\n"
                               "[2]"},
        {"help needed-by",
         "Usage: zq3hist needed-by [OPTION...] DIR TIMESTAMP\n"
         "\n"
         "List the restores that break without this image.\n"
         "\n"
         "  --json                   print JSON: see zq3hist-json(5)\n"
         "  -d ALIAS                 in place of DIR: the database's directory in $ZQ3DBPATH\n"
         "[0]"},
    };
    run("load h/", tenDays());
    run("load e/", "", "mkdir e; ");
    spill(root + "have", "# on hand\n 20250101010000\n\n2025-01-02 01:00:00\r\n20250109010000\n");
    for (const auto& row : rows)
        EXPECT_EQ(row.output, run(row.arguments)) << row.arguments;
}

// Where a chain is broken or an image is not there, the hint is a command that answers.
TEST_F(QuestionTest, HintsLeadToAnAnswer)
{
    run("load h/", tenDays());
    for (const char* question :
         {"plan h/ latest b", "plan h/ 20250108010000", "plan h/ 20250107010000",
          "plan h/ --before 20241231000000", "needed-by h/ 20250107010000"}) {
        std::string said = run(question);
        size_t begin = said.find("hint: zq3hist ") + strlen("hint: zq3hist ");
        ASSERT_GE(begin, strlen("hint: zq3hist ")) << said;
        EXPECT_TRUE(run(said.substr(begin, said.find("  #") - begin)).ends_with("[0]")) << said;
    }
}

// Names of any bytes, colors, widths, and the picture.
TEST_F(QuestionTest, ChartsAreDrawnForTheirPlace)
{
    const struct {
        const char* before;
        const char* arguments;
        const char* output;
    } rows[] = {
        {"", "images -d s",
         "TIMESTAMP       KIND         SCOPE       TABLESPACES  IMAGES  RESTORE\n"
         "20250101000000  delta        database              1       1  incomplete: <A>&\\x07 "
         "lacks a full image\n"
         "20250102000000  full         database              2       1  complete\n"
         "2 images, 1 incomplete; newest that can be restored: 20250102000000\n"
         "[0]"},
        {"", "plan S/ -d s latest",
         "zq3hist: plan takes a timestamp such as 20250111010000 or '2025-01-11 01:00:00', not S/\n"
         "Try 'zq3hist --help'.\n"
         "[2]"},
        {"", "chart --color S",
         "What the newest state needs\n"
         "\n"
         "          2025-01-01\n"
         "          |\n"
         "<A>&\\x07  \033[2md\033[0m  \033[2m.\033[0m\n"
         "2 others  \033[2m.\033[0m  \033[1;34mF\033[0m\n"
         "\n"
         "F I D  needed: full, incremental, delta\n"
         "f i d  not needed\n"
         ".      not in the image\n"
         "[0]"},
        {"COLUMNS=12 ", "chart w",
         "What the newest state needs\n"
         "\n"
         "A  :DDDDDDDD\n"
         "\n"
         "F I D  needed: full, incremental, delta\n"
         ":      5 images left out\n"
         "[0]"},
        {"COLUMNS=30 ", "chart w 20250101020000",
         "What 2025-01-01 02:00:00 needs\n"
         "\n"
         "   2024-12-31\n"
         "   |\n"
         "A  F  D  D  D\n"
         "\n"
         "F I D  needed: full, incremental, delta\n"
         "[0]"},
        {"NO_COLOR=1 ", "chart --color=auto w",
         "What the newest state needs\n"
         "\n"
         "   2024-12-31  2025-01-01  07:00 09:00 11:00\n"
         "   |           |           |     |     |\n"
         "A  F  d  d  d  I  D  D  D  D  D  D  D  D\n"
         "\n"
         "F I D  needed: full, incremental, delta\n"
         "f i d  not needed\n"
         "[0]"},
        {"", "chart --svg - S",
         "<svg xmlns=\"http://www.w3.org/2000/svg\" viewBox=\"0 0 400 180\" width=\"100%\" "
         "style=\"max-width:800px;height:auto\">\n"
         "<style>text{font-family:sans-serif;fill:#222}.h{font-size:15px;font-weight:bold}.s{font-"
         "size:11px}.n{font-size:10px}.t{font-size:9px;fill:#555}path{stroke:#999;fill:none}.F{"
         "fill:#0072b2}.I{fill:#e69f00}.D{fill:#009e73}.f{fill:#b3d4ea}.i{fill:#f7d99c}.d{fill:#"
         "b0dfcf}.X{fill:#fff;stroke:#aaa}.M{fill:#fff;stroke:#d55e00;stroke-width:2}.lF,.lI,.lD,."
         "lf,.li,.ld,.lX,.lM{font-size:10px;text-anchor:middle;font-weight:bold}.lF,.lD{fill:#fff}."
         "lf,.li,.ld{fill:#555;font-weight:normal}.lX{fill:#888}.lM{fill:#d55e00}</style>\n"
         "<rect width=\"100%\" height=\"100%\" fill=\"#fff\"/>\n"
         "<text class=\"h\" x=\"10\" y=\"24\">What the newest state needs</text>\n"
         "<text class=\"s\" x=\"10\" y=\"41\">2 images, the oldest first</text>\n"
         "<rect class=\"F\" x=\"10\" y=\"52\" width=\"12\" height=\"14\"/><text class=\"lF\" "
         "x=\"16.0\" y=\"63\">F</text><text class=\"t\" x=\"26\" y=\"62\">full, needed</text>\n"
         "<rect class=\"I\" x=\"110\" y=\"52\" width=\"12\" height=\"14\"/><text class=\"lI\" "
         "x=\"116.0\" y=\"63\">I</text><text class=\"t\" x=\"126\" y=\"62\">incremental, "
         "needed</text>\n"
         "<rect class=\"D\" x=\"250\" y=\"52\" width=\"12\" height=\"14\"/><text class=\"lD\" "
         "x=\"256.0\" y=\"63\">D</text><text class=\"t\" x=\"266\" y=\"62\">delta, needed</text>\n"
         "<rect class=\"f\" x=\"10\" y=\"71\" width=\"12\" height=\"14\"/><text class=\"lf\" "
         "x=\"16.0\" y=\"82\">f</text><text class=\"t\" x=\"26\" y=\"81\">full, not needed</text>\n"
         "<rect class=\"i\" x=\"110\" y=\"71\" width=\"12\" height=\"14\"/><text class=\"li\" "
         "x=\"116.0\" y=\"82\">i</text><text class=\"t\" x=\"126\" y=\"81\">incremental, not "
         "needed</text>\n"
         "<rect class=\"d\" x=\"250\" y=\"71\" width=\"12\" height=\"14\"/><text class=\"ld\" "
         "x=\"256.0\" y=\"82\">d</text><text class=\"t\" x=\"266\" y=\"81\">delta, not "
         "needed</text>\n"
         "<rect class=\"M\" x=\"10\" y=\"90\" width=\"12\" height=\"14\"/><text class=\"lM\" "
         "x=\"16.0\" y=\"101\">?</text><text class=\"t\" x=\"26\" y=\"100\">missing</text>\n"
         "<rect class=\"X\" x=\"110\" y=\"90\" width=\"12\" height=\"14\"/><text class=\"lX\" "
         "x=\"116.0\" y=\"101\">x</text><text class=\"t\" x=\"126\" y=\"100\">discarded by a "
         "restore</text>\n"
         "<path d=\"M66.5 127v4\"/><text class=\"t\" x=\"66\" y=\"125\">2025-01-01</text>\n"
         "<text class=\"n\" x=\"10\" y=\"143\">&#60;A&#62;&#38;\\x07</text>\n"
         "<text class=\"n\" x=\"10\" y=\"160\">2 others</text>\n"
         "<g><title>2025-01-01 00:00:00: delta, database\n"
         "&#60;A&#62;&#38;\\x07: not needed</title><rect class=\"d\" x=\"66\" y=\"132\" "
         "width=\"42\" height=\"14\"/><text class=\"ld\" x=\"87.0\" y=\"143\">d</text></g>\n"
         "<g><title>2025-01-02 00:00:00: full, database\n"
         "2 others: full, needed</title><rect class=\"F\" x=\"110\" y=\"149\" width=\"42\" "
         "height=\"14\"/><text class=\"lF\" x=\"131.0\" y=\"160\">F</text></g>\n"
         "</svg>\n"
         "[0]"},
        {"", "chart --color=red w",
         "zq3hist: --color takes always, never or auto, not red\n"
         "Try 'zq3hist --help'.\n"
         "[2]"},
    };
    setenv("ZQ3DBPATH", ".", 1);
    run("load S/",
        stanza("backup", 20250101000000, "Type: delta\n", {"<A>&\\x07"}) +
            stanza("backup", 20250102000000, "", {"B", "C"}),
        "mkdir S; ");
    std::string thirteen = stanza("backup", 20241231000000, "", {"A"});
    for (int hour = 0; hour < 12; hour++)
        thirteen += stanza("backup", 20250101000000 + hour * 10000,
                           hour == 3 ? "Type: incremental\n" : "Type: delta\n", {"A"});
    run("load w/", thirteen, "mkdir w; ");
    for (const auto& row : rows)
        EXPECT_EQ(row.output, run(row.arguments, "", row.before)) << row.arguments;
}

TEST_F(QuestionTest, AChecksLineBeginsWithTheGravest)
{
    const auto hoursAgo = [](int hours) {
        time_t seconds = time(nullptr) - hours * 3600 - 60;
        tm day;
        char text[16];
        strftime(text, sizeof text, "%Y%m%d%H%M%S", gmtime_r(&seconds, &day));
        return std::stoll(text);
    };
    long long full = hoursAgo(30), delta = hoursAgo(3);
    std::string three = "newest that can be restored: " + std::to_string(delta) + ", 3 hours old";
    std::string thirty = "newest that can be restored: " + std::to_string(full) + ", 30 hours old";
    const struct {
        const char* before;
        const char* arguments;
        std::string output;
    } rows[] = {
        {"", "h/ --max-age 3", "ok: 2 entries, 2 images, 0 incomplete; " + three + "\n[0]"},
        {"", "h/ --max-age 2",
         "no image: the newest image that can be restored is 3 hours old; 2 entries, 2 images, 0 "
         "incomplete; " +
             three + "\n[5]"},
        {"", "h/ --have have",
         "incomplete: tablespace A lacks the image " + std::to_string(delta) +
             " (2 tablespaces lack one); 2 entries, 2 images, 1 incomplete; " + thirty + "\n[6]"},
        {"rm h/zq3rhist.bak; ", "h/",
         "damaged: zq3rhist.bak is missing; 2 entries, 2 images, 0 incomplete; " + three + "\n[3]"},
        {"cp h/zq3rhist.asc h/zq3rhist.bak; truncate -s 1024 h/zq3rhist.asc; ", "h/ --max-age 2",
         "damaged: zq3rhist.asc ends after 0 of 2 entries; the newest image that can be "
         "restored is 3 hours old; 2 entries, 2 images, 0 incomplete; " +
             three + "\n[3]"},
        {"rm h/*; ", "h/", "damaged: the directory holds no history file\n[3]"},
    };
    run("load h/", stanza("backup", full, "", {"A", "B"}) +
                       stanza("backup", delta, "Type: delta\n", {"A", "B"}));
    spill(root + "have", std::to_string(full));
    for (const auto& row : rows)
        EXPECT_EQ(row.output, run(std::string("check ") + row.arguments, "",
                                  std::string("export TZ=UTC; ") + row.before))
            << row.arguments;
}

TEST_F(QuestionTest, TheManualListsEveryMember)
{
    const struct {
        const char* command;
        std::vector<std::pair<const char*, int>> calls;
    } rows[] = {
        {"images", {{"--all h/", 0}, {"--last 1 h/", 0}, {"e/", 0}}},
        {"plan",
         {{"h/ latest", 0},
          {"h/ 20250108010000", 6},
          {"h/ 20250105010000", 0},
          {"--have have h/ 20250102010000", 6}}},
        {"chart", {{"h/", 0}, {"h/ 20250102010000", 0}, {"s/", 0}}},
        {"check", {{"h/", 0}, {"e/", 5}, {"s/", 5}, {"g/", 0}}},
        {"unneeded", {{"--keep 1 h/", 0}}},
        {"needed-by", {{"h/ 20250101010000", 0}}},
    };
    run("load h/", tenDays());
    run("load e/", "", "mkdir e; ");
    run("load s/", stanza("backup", 20250101000000, "Type: delta\n", {"A"}), "mkdir s; ");
    run("load g/",
        stanza("backup", 20250101000000, "", {"A"}) +
            stanza("backup", 20250102000000, "Type: delta\nNumber: 5\n", {"A"}),
        "mkdir g; ");
    spill(root + "have", "");
    for (const auto& row : rows) {
        manualSection manual(row.command);
        for (const auto& [arguments, status] : row.calls)
            manual.check(ask(std::string(row.command) + " --json " + arguments, status));
    }
}

// A year: weekly full, daily incremental, hourly delta images of twelve tablespaces, one of which
// is renamed each month; a restore each month; and a Sunday without its full image.
static std::string aYear()
{
    std::vector<std::string> names;
    for (int i = 0; i < 12; i++)
        names.push_back("SPACE" + std::to_string(i));
    std::string text;
    for (time_t hour = 0; hour < 366 * 24; hour++) {
        time_t seconds = 1704067200 + hour * 3600; // from 2024-01-01, a Monday
        tm day;
        gmtime_r(&seconds, &day);
        long long time = (day.tm_year + 1900) * 10000000000 + (day.tm_mon + 1) * 100000000 +
                         day.tm_mday * 1000000 + day.tm_hour * 10000;
        bool daily = day.tm_hour == 1, weekly = daily && day.tm_wday == 0;
        if (weekly && day.tm_yday == 308)
            continue;
        text += stanza("backup", time,
                       weekly  ? ""
                       : daily ? "Type: incremental\n"
                               : "Type: delta\n",
                       names);
        if (day.tm_mday == 15 && day.tm_hour == 3) {
            std::string old = names[0];
            names[0] = "RENAMED" + std::to_string(day.tm_mon);
            text += stanza("rename tablespace", time + 1, "", {old, names[0]});
        }
        if (day.tm_mday == 20 && day.tm_hour == 5)
            text +=
                stanza("restore", time + 1, "Id: " + std::to_string(time - 20000) + "\n", names);
    }
    return text;
}

TEST_F(QuestionTest, EveryQuestionAboutAYearIsAnsweredWithinASecond)
{
    EXPECT_EQ("8808 entries appended\n[0]", run("load h/", aYear()));
    for (const char* question :
         {"images h/", "images --json h/", "plan h/ latest", "plan h/ --before 20241110000000",
          "chart h/", "chart h/ --svg -", "check h/", "unneeded --keep 30 h/",
          "needed-by h/ 20241027010000", "status h/", "verify h/"}) {
        timespec start, end;
        clock_gettime(CLOCK_MONOTONIC, &start);
        EXPECT_FALSE(run(question).empty());
        clock_gettime(CLOCK_MONOTONIC, &end);
        double seconds = static_cast<double>(end.tv_sec - start.tv_sec) +
                         static_cast<double>(end.tv_nsec - start.tv_nsec) / 1e9;
        EXPECT_LT(seconds, 1) << question;
        printf("%-35s %.3f s\n", question, seconds);
    }
    EXPECT_EQ("[1]", run("images h/ >pipe", "", "mkfifo pipe; head -1 pipe >first & "))
        << "whoever reads only the beginning is not told of it";
}
