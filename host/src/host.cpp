// Placeholder until the reference host lands.
namespace plano_host {
extern const char kName[] = "plano_host";
}
