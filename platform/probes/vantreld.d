/*
 * The daemon's user-level static trace probes. A double underscore in a
 * probe name reads as a dash to a tracer: request__input is "request-input".
 * The probe sites are in Probes.cpp; keep the two in step.
 */

provider vantreld {
	probe client__new(int);
	probe client__done(int);
	probe request(int, char *);
	probe request__input(int, char *);
	probe request__output(int, char *);
	probe db__load(char *, uint64_t);
	probe discover__raw(unsigned int);
	probe plugin__add(char *);
	probe plugin__ready(char *);
	probe plugin__remove(char *, bool);
};

/*
 * Interface stability: Private/Private/Unknown throughout. These lines stay
 * after the provider block; the header generator treats them as comments.
 */
#pragma D attributes Private/Private/Unknown provider vantreld provider
#pragma D attributes Private/Private/Unknown provider vantreld module
#pragma D attributes Private/Private/Unknown provider vantreld function
#pragma D attributes Private/Private/Unknown provider vantreld name
#pragma D attributes Private/Private/Unknown provider vantreld args
