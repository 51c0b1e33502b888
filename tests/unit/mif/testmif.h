// A small component with a scalar group and three tables, for the catalogue
// and value formatting tests.
#pragma once

inline const char* testComponentMif()
{
    return R"MIF(start component
    name = "Catalogue Test"
    description = "Groups for catalogue and formatting tests"
    start group
        name = "Scalars"
        class = "Test|Scalars|001"
        id = 1
        start attribute
            name = "Count"
            id = 1
            description = "A plain integer"
            type = integer
            access = read-write
            value = 42
        end attribute
        start attribute
            name = "State"
            id = 2
            type = start enum
                0 = "Off"
                1 = "On"
                2 = "Failed"
            end enum
            access = read-write
            value = "Off"
        end attribute
        start attribute
            name = "Label"
            id = 3
            type = displaystring(64)
            access = read-write
            value = "plain text"
        end attribute
        start attribute
            name = "When"
            id = 4
            type = date
            access = read-write
            value = "20261206113005.123456+060"
        end attribute
        start attribute
            name = "Events"
            id = 5
            type = counter
            access = read-write
            value = 7
        end attribute
        start attribute
            name = "Level"
            id = 6
            type = gauge
            access = read-write
            value = 99
        end attribute
    end group
    start group
        name = "Named Rows"
        class = "Test|Named Rows|001"
        id = 2
        key = 1
        start attribute
            name = "Index"
            id = 1
            type = integer
            access = read-only
            value = 0
        end attribute
        start attribute
            name = "Short Name"
            id = 2
            type = displaystring(32)
            access = read-write
            value = ""
        end attribute
        start attribute
            name = "Description"
            id = 3
            type = displaystring(64)
            access = read-write
            value = ""
        end attribute
    end group
    start table
        name = "Named Rows"
        class = "Test|Named Rows|001"
        id = 2
        { 10, "CPU 1", "First processor" }
        { 20, "CPU 2", "Second processor" }
        { 30, "CPU 3", "Third processor" }
    end table
    start group
        name = "Described Rows"
        class = "Test|Described Rows|001"
        id = 3
        key = 1
        start attribute
            name = "Index"
            id = 1
            type = integer
            access = read-only
            value = 0
        end attribute
        start attribute
            name = "Description"
            id = 2
            type = displaystring(64)
            access = read-write
            value = ""
        end attribute
    end group
    start table
        name = "Described Rows"
        class = "Test|Described Rows|001"
        id = 3
        { 1, "Fan in front" }
    end table
    start group
        name = "Bare Rows"
        class = "Test|Bare Rows|001"
        id = 4
        key = 1
        start attribute
            name = "Index"
            id = 1
            type = integer
            access = read-only
            value = 0
        end attribute
        start attribute
            name = "Reading"
            id = 2
            type = integer
            access = read-write
            value = 0
        end attribute
    end group
    start table
        name = "Bare Rows"
        class = "Test|Bare Rows|001"
        id = 4
        { 5, 500 }
    end table
end component
)MIF";
}
