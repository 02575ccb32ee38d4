// The questions that zq3hist answers about images.
#include <nlohmann/json.hpp>
#include <random>

#include "tests/admin/program.h"

using nlohmann::json;

class QuestionTest : public ProgramTest
{
  protected:
    json ask(const std::string& arguments, int status = 0)
    {
        std::string text = run(arguments);
        EXPECT_TRUE(text.ends_with("[" + std::to_string(status) + "]")) << arguments << text;
        json answer = json::parse(slurp(root + "out"));
        EXPECT_EQ(1, answer["format"]);
        return answer;
    }
};

static std::string stanza(const std::string& operation, long timestamp, const std::string& rest,
                          const std::vector<std::string>& names = {})
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
    for (long time = 20250101000000; time < 20250101000040; time++) {
        std::vector<std::string> some;
        for (const std::string& name : names)
            if (random() % 3 != 0)
                some.push_back(name);
        long earlier = 20250101000000 + static_cast<long>(random() % 40);
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
            text +=
                stanza("backup", time, std::string("Type: ") + types[random() % 4] + "\n", some);
        }
        *onHand += random() % 20 != 0 ? std::to_string(time) + "\n" : "";
    }
    return text;
}

// The list of all images comes of one walk, a plan of the planner's stages: they must agree.
TEST_F(QuestionTest, TheListOfImagesSaysWhatThePlansSay)
{
    std::mt19937 random(11);
    int complete = 0, incomplete = 0;
    for (int round = 0; round < 20; round++) {
        std::string onHand;
        run("load h/", anyHistory(random, &onHand), "rm -f h/*; ");
        spill(root + "have", onHand);
        std::string have = round % 2 == 0 ? "" : " --have have";
        json list = ask("images --json h/" + have);
        for (json& image : list["images"]) {
            std::string target = image["timestamp"];
            json plan = ask("plan --json h/ " + target + have, image["complete"] ? 0 : 6);
            EXPECT_EQ(plan["complete"], image["complete"]) << target;
            EXPECT_EQ(plan["imageCount"], image["imageCount"]) << target;
            EXPECT_EQ(plan["missing"], image["missing"]) << target;
            (image["complete"] ? complete : incomplete)++;
        }
    }
    EXPECT_GT(complete, 100);
    EXPECT_GT(incomplete, 100);
}
