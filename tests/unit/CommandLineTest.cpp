#include "CommandLine.h"

#include <gtest/gtest.h>

TEST(CommandLine, FindsWholeTrailingSwitchesOnly)
{
    EXPECT_EQ(FindServerCommand(R"("C:\opc\Local.exe" /regserver)"), ServerCommand::RegServer);
    EXPECT_EQ(FindServerCommand(R"(Local.exe -UnregServer)"), ServerCommand::UnregServer);
    EXPECT_EQ(FindServerCommand(R"(Local.exe /UNREGSERVER)"), ServerCommand::UnregServer);
    EXPECT_EQ(FindServerCommand(R"(C:\my-tools\Local.exe /RegServer)"), ServerCommand::RegServer)
        << "the search resumes after a separator inside the path";
    EXPECT_EQ(FindServerCommand(R"(Local.exe /RegServer /s)"), ServerCommand::Run);
    EXPECT_EQ(FindServerCommand(R"(Local.exe /RegServer )"), ServerCommand::Run);
    EXPECT_EQ(FindServerCommand(R"(Local.exe -Embedding)"), ServerCommand::Run);
    EXPECT_EQ(FindServerCommand(R"(Local.exe /Reg)"), ServerCommand::Run);
    EXPECT_EQ(FindServerCommand(R"(Local.exe RegServer)"), ServerCommand::Run);
    EXPECT_EQ(FindServerCommand(""), ServerCommand::Run);
    EXPECT_EQ(FindServerCommand("/"), ServerCommand::Run);
    EXPECT_EQ(FindServerCommand(nullptr), ServerCommand::Run);
}
