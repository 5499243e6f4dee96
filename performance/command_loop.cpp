/// Usage: command-loop FILE
/// Runs each line of FILE with system(3), one after the other: the minimum that a program must do to run these
/// commands.

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>

int main(int argc, char** argv)
{
    std::ifstream commands(argc == 2 ? argv[1] : "");
    if (!commands) {
        std::fprintf(stderr, "command-loop: no file of commands. Usage: command-loop FILE\n");
        return 2;
    }
    for (std::string command; std::getline(commands, command);) {
        if (std::system(command.c_str()) == -1) {
            std::perror("command-loop");
            return 1;
        }
    }
    return 0;
}
