// plano: planar tracking, screen replacement and review overlays on image sequences.
#include <csignal>
#include <cstdio>
#include <exception>

#include "commands.hpp"

int main(int argc, char **argv)
{
    using namespace plano_tool;
    catch_interrupts();
    // Past a file-size limit a write then fails with an error the tool reports, instead of
    // the signal ending the process half-way through a file.
    std::signal(SIGXFSZ, SIG_IGN);
    CLI::App app("plano: planar tracking of image sequences with the Plano engine");
    app.require_subcommand(1);
    int exit_code = 0;
    add_track_command(app, exit_code);
    add_insert_command(app, exit_code);
    add_overlay_command(app, exit_code);
    add_stabilise_command(app, exit_code);
    add_demo_command(app, exit_code);
    if (argc < 2) {
        std::fputs(app.help().c_str(), stdout);
        return kExitFailure;
    }
    std::string command = argv[1];
    try {
        app.parse(argc, argv);
    } catch (const CLI::CallForHelp &e) {
        return app.exit(e);
    } catch (const CLI::CallForAllHelp &e) {
        return app.exit(e);
    } catch (const CLI::ParseError &e) {
        bool known = false;
        for (const CLI::App *sub : app.get_subcommands({})) known = known || sub->get_name() == command;
        std::fprintf(stderr, "plano: %s (see plano %s--help)\n", one_line(e.what()).c_str(), known ? (command + " ").c_str() : "");
        return kExitFailure;
    } catch (const ToolError &e) {
        std::fprintf(stderr, "plano %s: %s\n", command.c_str(), e.what());
        return e.exit_code();
    } catch (const std::bad_alloc &) {
        std::fprintf(stderr, "plano %s: out of memory\n", command.c_str());
        return kExitFailure;
    } catch (const std::exception &e) {
        std::fprintf(stderr, "plano %s: %s\n", command.c_str(), one_line(e.what()).c_str());
        return kExitFailure;
    }
    return exit_code;
}
