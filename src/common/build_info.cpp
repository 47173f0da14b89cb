// Nothing exported: keeps the engine library non-empty while subsystems are added.
namespace plano {
extern const char kBuildName[] = "plano";
}
