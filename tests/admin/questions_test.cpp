// The questions that zq3hist answers about images.
#include <nlohmann/json.hpp>
#include <random>
#include <regex>

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

// A history of anything that can happen to four tablespaces. twice: no renames, but images that
// list a name twice.
static std::string anyHistory(std::mt19937& random, std::string* onHand, bool twice = false)
{
    static const char* const types[] = {"full", "incremental", "delta", "delta"};
    static const std::vector<std::string> names = {"A", "B", "C", "D"};
    std::string text;
    for (long long time = 20250101000000; time < 20250101000040; time++) {
        std::vector<std::string> some;
        for (const std::string& name : names)
            for (unsigned long i = random() % 9; i > 2; i = twice && i == 8 ? 3 : 0)
                some.push_back(name);
        const std::string earlier = std::to_string(20250101000000 + random() % 40);
        const unsigned long kind = random() % 12;
        if (kind == 0)
            text += stanza("restore", time, "Id: " + earlier + "\n", some);
        else if (kind == 1)
            text += stanza("create tablespace", time, "", {names[random() % 4]});
        else if (kind == 2 && !twice)
            text +=
                stanza("rename tablespace", time, "", {names[random() % 4], names[random() % 4]});
        else
            text += stanza("backup", time,
                           std::string("Type: ") + types[random() % 4] +
                               "\nObject: " + (random() % 2 == 0 ? "tablespace\n" : "database\n"),
                           some);
        *onHand += random() % 20 != 0 ? std::to_string(time) + "\n" : "";
    }
    return text;
}

// The images of a list that are needed.
static std::set<std::string> timestampsOf(const json& images)
{
    std::set<std::string> timestamps;
    for (const json& image : images)
        if (image.value("known", true) && image.value("needed", true))
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
        run("load h/", anyHistory(random, &onHand, round % 4 == 2), "rm -f h/*; ");
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
                json chart = ask("chart --json h/ " + target);
                EXPECT_EQ(needed, timestampsOf(chart["images"])) << target;
                std::set<std::string> shown;
                for (const json& row : chart["rows"])
                    for (const std::string name : row["tablespaces"])
                        EXPECT_TRUE(shown.insert(name).second) << target << name;
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
         "7 images, 8 shown, 1 incomplete; newest that can be restored: 20250109010000\n[0]"},
        {"images --since '2025-01-05T01:00:00' --incomplete h/",
         "TIMESTAMP       KIND         SCOPE       TABLESPACES  IMAGES  RESTORE\n"
         "20250108010000  delta        database              2       4  incomplete: B lacks the "
         "image 20241201010000\n"
         "7 images, 1 shown, 1 incomplete; newest that can be restored: 20250109010000\n[0]"},
        {"images e/", "TIMESTAMP       KIND         SCOPE       TABLESPACES  IMAGES  RESTORE\n"
                      "0 images, 0 incomplete\n[0]"},
        {"images s/", "TIMESTAMP       KIND         SCOPE       TABLESPACES  IMAGES  RESTORE\n"
                      "20250101000000  delta        database              1       1  incomplete: A "
                      "lacks a full image\n"
                      "1 image, 1 incomplete\n[0]"},
        {"images --have have --last 3 h/",
         "TIMESTAMP       KIND         SCOPE       TABLESPACES  IMAGES  RESTORE\n"
         "20250105010000  delta        database              2       4  incomplete: all 2 lack the "
         "image 20250105010000\n"
         "20250108010000  delta        database              2       4  incomplete: all 2 lack the "
         "image 20250108010000\n"
         "20250109010000  full         database              1       1  complete\n"
         "7 images, 3 shown, 4 incomplete; newest that can be restored: 20250109010000\n[0]"},
        {"plan h/ '2025-01-05 01:00:00'",
         "1/4  full         20250101010000  A  for 20250103010000\n"
         "2/4  incremental  20250103010000  A  for 20250105010000\n"
         "3/4  full         20250104010000  B  for 20250105010000\n"
         "4/4  delta        20250105010000  all 2  target\n"
         "zq3hist: warning: a chain was found, but the history lacks entries 5 to 6, and an image "
         "may have been there\n[0]"},
        {"plan h/ latest b",
         "zq3hist: tablespace B lacks the image 20241201010000 that was restored, 20250108010000\n"
         "zq3hist: hint: zq3hist plan h/ 20250105010000  # the newest image that can be "
         "restored\n[6]"},
        {"plan --before 20250107000000 -- h/ A",
         "1/3  full         20250101010000  A  for 20250103010000\n"
         "2/3  incremental  20250103010000  A  for 20250105010000\n"
         "3/3  delta        20250105010000  A  target\n"
         "zq3hist: warning: a chain was found, but the history lacks entries 5 to 6, and an image "
         "may have been there\n[0]"},
        {"plan --before 20250104020000 h/",
         "1/1  full         20250104010000  B  target\n"
         "zq3hist: note: 20250104010000 is an image of single tablespaces; the newest one of the "
         "whole database before it is 20250103010000\n[0]"},
        {"plan h/ --before 20241231000000", "zq3hist: no image is there up to 20241231000000, h/\n"
                                            "zq3hist: hint: zq3hist images h/  # lists all\n[5]"},
        {"plan --have have h/ 20250105010000",
         "zq3hist: all 2 tablespaces lack the image 20250105010000, which is not on hand, "
         "20250105010000\n"
         "zq3hist: hint: zq3hist plan h/ 20250109010000  # the newest image that can be "
         "restored\n[6]"},
        {"plan h/ 20250109010000 A C",
         "zq3hist: the image does not hold the tablespace C, 20250109010000\n[5]"},
        {"chart h/", "What the newest state needs\n\n"
                     "   2025-01-01  01-05 01-09\n"
                     "   |           |     |\n"
                     "A  f  d  i  .  d  d  F\n"
                     "B  x  x  x  x  x  d  .\n\n"
                     "F I D  needed: full, incremental, delta\n"
                     "f i d  not needed\n"
                     "x      discarded by a restore\n"
                     ".      not in the image\n[0]"},
        {"chart h/ 20250105010000", "What 2025-01-05 01:00:00 needs\n\n"
                                    "   2025-01-01  01-05\n"
                                    "   |           |\n"
                                    "A  F  d  I  .  D\n"
                                    "B  f  d  i  F  D\n\n"
                                    "F I D  needed: full, incremental, delta\n"
                                    "f i d  not needed\n"
                                    ".      not in the image\n[0]"},
        {"unneeded --since 20250108000000 h/",
         "20250102010000  delta        database\n"
         "20250104010000  full         tablespace\n"
         "2 of 7 images are not needed by restores from 20250108000000\n[0]"},
        {"unneeded --keep 2 h/",
         "20250102010000  delta        database\n"
         "1 of 7 images are not needed by restores from 20250105010000\n[0]"},
        {"unneeded --since 20260101000000 h/",
         "zq3hist: no image is there from then on: 20260101000000, h/\n[5]"},
        {"needed-by h/ 20250103010000", "20250105010000  delta        database\n"
                                        "1 of 7 images need 20250103010000\n[0]"},
        {"images --last 1 d/",
         "TIMESTAMP       KIND         SCOPE       TABLESPACES  IMAGES  RESTORE\n"
         "20250104000000  delta        database              1       4  complete\n"
         "6 images, 1 shown, 1 incomplete; newest that can be restored: 20250104000000\n[0]"},
        {"unneeded --keep 1 d/",
         "20250101010000  delta        database\n"
         "1 of 6 images are not needed by restores from 20250104000000\n[0]"},
        {"needed-by d/ 20250102000000",
         "20250103000000  delta        database\n20250103000000  delta        database\n"
         "20250104000000  delta        database\n"
         "3 of 6 images need 20250102000000\n[0]"},
        {"plan d/ 20250101010000",
         "zq3hist: tablespace B lacks the image that a restore used, which has no name, "
         "20250101010000\n"
         "zq3hist: hint: zq3hist plan d/ 20250104000000  # the newest image that can be "
         "restored\n[6]"},
        {"plan h/ 20250106010000",
         "zq3hist: the image 20250106010000 failed, h/\n"
         "zq3hist: hint: zq3hist images --all h/  # also lists those that failed\n[5]"},
        {"needed-by h/ 20250107010000", "zq3hist: no image has the timestamp 20250107010000, h/\n"
                                        "zq3hist: hint: zq3hist images h/  # lists all\n[5]"},
        {"help needed-by",
         "Usage: zq3hist needed-by [OPTION...] DIR TIMESTAMP\n\n"
         "List the restores that break without this image.\n\n"
         "  --json                   print JSON: see zq3hist-json(5)\n"
         "  -d ALIAS                 in place of DIR: the database's directory in $ZQ3DBPATH\n[0]"},
    };
    run("load h/", tenDays());
    run("load e/", "", "mkdir e s d; ");
    const std::string twice = stanza("backup", 20250102000000, "", {"A"}) +
                              stanza("backup", 20250103000000, "Type: delta\n", {"A"});
    run("load d/",
        stanza("restore", 20250101000000, "", {"B"}) +
            stanza("backup", 20250101010000, "Type: delta\n", {"B"}) + twice + twice +
            stanza("backup", 20250104000000, "Type: delta\nNode: 2\nNumber: 50\n", {"A"}));
    run("load s/", stanza("backup", 20250101000000, "Type: delta\n", {"A"}));
    spill(root + "have", "# on hand\n 20250101010000\n\n2025-01-02 01:00:00\r\n20250109010000\n");
    for (const auto& row : rows) {
        const std::string said = row.output, mark = "hint: zq3hist ";
        EXPECT_EQ(said, run(row.arguments)) << row.arguments;
        if (size_t hint = said.find(mark); hint != std::string::npos) {
            hint += mark.size();
            EXPECT_TRUE(run(said.substr(hint, said.find("  #") - hint)).ends_with("[0]")) << said;
        }
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
         "20250101010000  delta        database              3       1  incomplete: <A>&\\x07 "
         "lacks the image 20241201000000, B lacks a full image, C lacks a full image\n"
         "20250101120000  full         database              0       1  complete\n"
         "20250102000000  full         database              2       2  complete\n"
         "20250103000000  full         tablespace            2       2  complete\n"
         "4 images, 1 incomplete; newest that can be restored: 20250103000000\n[0]"},
        {"", "plan -d s 20250101010000",
         "zq3hist: tablespace <A>&\\x07 lacks the image 20241201000000 that was restored, "
         "20250101010000\n"
         "zq3hist: tablespace B and 1 more lack a full image, 20250101010000\n"
         "zq3hist: hint: zq3hist plan ./S/ 20250102000000  # the newest image that can be "
         "restored\n[6]"},
        {"", "plan S latest",
         "1/2  full         20250101120000\n"
         "2/2  full         20250103000000  all 2  target\n"
         "zq3hist: note: 20250103000000 is an image of single tablespaces; the newest one of the "
         "whole database before it is 20250102000000\n[0]"},
        {"", "unneeded --keep 9 S",
         "0 of 4 images are not needed by restores from 20250101010000\n[0]"},
        {"", "needed-by S 20250101120000",
         "20250102000000  full         database\n"
         "20250103000000  full         tablespace\n"
         "2 of 4 images need 20250101120000\n[0]"},
        {"", "chart --color S",
         "What the newest state needs\n\n"
         "          2025-01-01\n"
         "          |\n"
         "<A>&\\x07  \033[2md\033[0m  \033[2m.\033[0m  \033[2m.\033[0m  \033[2m.\033[0m\n"
         "2 others  \033[2md\033[0m  \033[2m.\033[0m  \033[2mf\033[0m  \033[1;34mF\033[0m\n\n"
         "F I D  needed: full, incremental, delta\n"
         "f i d  not needed\n"
         ".      not in the image\n[0]"},
        {"COLUMNS=12 ", "chart w",
         "What the newest state needs\n\n"
         "A  :DDDDDDDD\n\n"
         "F I D  needed: full, incremental, delta\n"
         ":      5 images left out\n[0]"},
        {"COLUMNS=30 ", "chart w 20250101020000",
         "What 2025-01-01 02:00:00 needs\n\n"
         "   2024-12-31\n"
         "   |\n"
         "A  F  D  D  D\n\n"
         "F I D  needed: full, incremental, delta\n[0]"},
        {"NO_COLOR=1 ", "chart --color=auto w",
         "What the newest state needs\n\n"
         "   2024-12-31  2025-01-01  07:00 09:00 11:00\n"
         "   |           |           |     |     |\n"
         "A  F  d  d  d  I  D  D  D  D  D  D  D  D\n\n"
         "F I D  needed: full, incremental, delta\n"
         "f i d  not needed\n[0]"},
    };
    setenv("ZQ3DBPATH", ".", 1);
    run("load S/",
        stanza("restore", 20250101000000, "Id: 20241201000000\n", {"<A>&\\x07"}) +
            stanza("backup", 20250101010000, "Type: delta\n", {"<A>&\\x07", "B", "C"}) +
            stanza("backup", 20250101120000, "") +
            stanza("backup", 20250102000000, "", {"B", "C"}) +
            stanza("backup", 20250103000000, "Object: tablespace\n", {"B", "C"}),
        "mkdir S; ");
    std::string thirteen = stanza("backup", 20241231000000, "", {"A"});
    for (int hour = 0; hour < 12; hour++)
        thirteen += stanza("backup", 20250101000000 + hour * 10000,
                           hour == 3 ? "Type: incremental\n" : "Type: delta\n", {"A"});
    run("load w/", thirteen, "mkdir w; ");
    for (const auto& row : rows)
        EXPECT_EQ(row.output, run(row.arguments, "", row.before)) << row.arguments;

    EXPECT_EQ("[0]", run("chart --svg picture S 20250101010000"));
    const std::string picture = slurp(root + "picture"), bands = "<path d=\"";
    EXPECT_EQ(R"(<path d="M66.5 127v4"/><text class="t" x="66" y="125">2024-12-01</text>
<path d="M154.5 127v4"/><text class="t" x="154" y="125">2025-01-01</text>
<text class="n" x="10" y="143">&#60;A&#62;&#38;\x07</text>
<text class="n" x="10" y="160">2 others</text>
<g><title>2024-12-01 00:00:00: missing
&#60;A&#62;&#38;\x07: missing</title><rect class="M" x="66" y="132" width="42" height="14"/><text class="lM" x="87.0" y="143">?</text></g>
<g><title>A full image: missing
2 others: missing</title><rect class="M" x="110" y="149" width="42" height="14"/><text class="lM" x="131.0" y="160">?</text></g>
<g><title>2025-01-01 01:00:00: delta, database
&#60;A&#62;&#38;\x07: delta, needed
2 others: delta, needed</title><rect class="D" x="154" y="132" width="42" height="14"/><text class="lD" x="175.0" y="143">D</text><rect class="D" x="154" y="149" width="42" height="14"/><text class="lD" x="175.0" y="160">D</text></g>
</svg>
)",
              picture.substr(picture.find(bands)));
    const std::regex classes("class=\"([^\"]*)\"");
    for (std::sregex_iterator at(picture.begin(), picture.end(), classes), end; at != end; ++at)
        EXPECT_NE(std::string::npos, std::min(picture.find("." + at->str(1) + "{"),
                                              picture.find("." + at->str(1) + ",")))
            << "nothing says how to draw " << at->str();

    // Where there is no room for letters the kinds differ in height.
    std::string many = stanza("backup", 20240101000000, "Type: incremental\n", {"A"});
    for (int i = 0; i < 500; i++)
        many += stanza("backup", 20240101000100 + i / 60 * 100 + i % 60,
                       i % 9 == 0 ? "" : "Type: delta\n", {"A"});
    run("load n/", many, "mkdir n; ");
    EXPECT_EQ("[0]", run("chart --svg narrow n"));
    const std::string narrow = slurp(root + "narrow");
    for (const char* cell : {"F\"[^>]*\"14", "i\"[^>]*\"9", "D\"[^>]*\"4"})
        EXPECT_TRUE(std::regex_search(narrow, std::regex("class=\"" + std::string(cell) + "\"/>")))
            << cell;
    EXPECT_NE(std::string::npos, narrow.find("class=\"lM\""));
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
    std::string three =
        "newest that can be restored: " + std::to_string(delta) +
        ", 3 hours old; warning: its chain was found, but the history lacks entry 2";
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
                       stanza("backup", delta, "Type: delta\nNumber: 3\n", {"A", "B"}));
    spill(root + "have", std::to_string(full));
    for (const auto& row : rows)
        EXPECT_EQ(row.output, run(std::string("check ") + row.arguments, "",
                                  std::string("export TZ=UTC; ") + row.before))
            << row.arguments;
}

// Histories: h of ten days, e empty, s without a full image, g with a gap; those of b are broken.
TEST_F(QuestionTest, TheManualListsEveryMember)
{
    const struct {
        const char* command;
        std::vector<std::string> calls;
    } rows[] = {
        {"images", {"--all h", "--last 1 h", "e"}},
        {"plan",
         {"h latest", "h 20250108010000", "h 20250105010000", "--have have h 20250102010000"}},
        {"chart", {"h", "h 20250102010000", "s"}},
        {"check", {"h", "e", "s", "g"}},
        {"unneeded", {"--keep 1 h"}},
        {"needed-by", {"h 20250101010000"}},
        {"dump", {"h", "e"}},
        {"status", {"h", "b/none", "b/header"}},
        {"verify", {"h", "b/cut", "b/entry"}},
        {"repair", {"--dry-run h", "b/entry"}},
        {"load", {"e more", "--skip-existing e more"}},
    };
    run("load h", tenDays());
    run("load e", "", "mkdir e s g b; ");
    run("load s", stanza("backup", 20250101000000, "Type: delta\n", {"A"}));
    run("load g", stanza("backup", 20250101000000, "", {"A"}) +
                      stanza("backup", 20250102000000, "Type: delta\nNumber: 5\n", {"A"}));
    spill(root + "have", "");
    spill(root + "more", stanza("backup", 20250101000000, "", {"A"}));
    EXPECT_EQ(0, system(("cd " + root +
                         "; for b in none cut entry header; do cp -r g b/$b; done; "
                         "rm b/none/*.asc; truncate -s 1803 b/cut/*.asc; "
                         "for at in entry:2000 header:10; do printf '\\377' | dd of=b/${at%:*}/"
                         "zq3rhist.bak seek=${at#*:} bs=1 conv=notrunc status=none; done")
                            .c_str()));
    for (const auto& row : rows) {
        SCOPED_TRACE(row.command);
        manualSection manual(row.command);
        for (const std::string& arguments : row.calls) {
            run(std::string(row.command) + " --json " + arguments);
            std::istringstream out(slurp(root + "out"));
            for (std::string line; std::getline(out, line);)
                manual.check(json::parse(line));
        }
    }
}
