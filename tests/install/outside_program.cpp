// A program outside the tree, built against the installed headers and library only.
#include <s2s.h>

#include <cstdio>

int main() {
    S2S::Logger::Initialize(S2S::Logger::Stdout, S2S::Logger::Note, "", 0);
    S2S::PObject task;
    task["name"] = "demo";
    task["shares"].asArray().push_back(S2S::PObject("docs"));
    task["shares"].asArray().push_back(S2S::PObject("media"));
    std::printf("%s\n%s\n", task.toString().c_str(), S2S::StatusMessage(S2S::kStatusProtocolError));
    std::fflush(stdout);
    S2S::Logger::LogMsg(S2S::Logger::Note, "[NOTE] outside.cpp(%d): logged\n", 7);
    return 0;
}
