#include "fuzz/FuzzTargets.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <random>
#include <set>
#include <string>
#include <vector>

// What a fuzzer without instruments can do: the texts that the targets have, and small changes of them.

namespace {

const std::filesystem::path kCorpus = MEMWEIGHT_FUZZ_CORPUS;

std::vector<std::string> textsOf(const FuzzTarget& target) {
    std::vector<std::string> texts;
    for (const auto& entry : std::filesystem::directory_iterator(kCorpus / target.name)) {
        std::ifstream file(entry.path());
        texts.emplace_back(std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>());
    }
    std::ranges::sort(texts);
    return texts;
}

void expectPromisesKept(const FuzzTarget& target, const std::string& text) {
    EXPECT_NO_THROW(target.read(text)) << target.name << ": " << testing::PrintToString(text);
}

TEST(FuzzTargets, AreTheFoldersOfTheCorpus) {
    std::set<std::string> folders;
    for (const auto& entry : std::filesystem::directory_iterator(kCorpus)) {
        folders.insert(entry.path().filename());
    }
    std::set<std::string> targets;
    for (const FuzzTarget& target : fuzzTargets()) {
        targets.insert(std::string(target.name));
        EXPECT_GE(textsOf(target).size(), 2U) << target.name;
    }
    EXPECT_EQ(folders, targets);
}

TEST(FuzzTargets, KeepTheirPromises) {
    for (const FuzzTarget& target : fuzzTargets()) {
        for (const std::string& text : textsOf(target)) {
            expectPromisesKept(target, text);
        }
    }
}

TEST(FuzzTargets, KeepTheirPromisesWhenTextsAreChanged) {
    constexpr int kRounds = 10000;
    const std::string pieces[] = {"{", "}", "[",   "]",    ",",          ":",      "\"",   "-",  "(",
                                  ")", " ", "1e9", "null", "\"start\":", "+0x1/2", "kB\n", "\t", "\n"};
    std::mt19937 random(7);
    for (const FuzzTarget& target : fuzzTargets()) {
        const std::vector<std::string> texts = textsOf(target);
        for (int round = 0; round < kRounds; ++round) {
            std::string text = texts[random() % texts.size()];
            for (unsigned change = random() % 4; change != 0 && !text.empty(); --change) {
                const size_t at = random() % text.size();
                switch (random() % 4) {
                    case 0:
                        text[at] = static_cast<char>(random());
                        break;
                    case 1:
                        text.erase(at, random() % 8);
                        break;
                    case 2:
                        text.insert(at, pieces[random() % std::size(pieces)]);
                        break;
                    default:
                        text.insert(at, text.substr(random() % text.size(), 16 * (random() % 8)));
                }
            }
            expectPromisesKept(target, text);
        }
    }
}

}  // namespace
